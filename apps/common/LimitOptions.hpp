// Command-line options for the limits of a session.
#pragma once

#include <CLI/CLI.hpp>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <string_view>

#include "foundation/msg_svc/transport/layers/session/Limits.hpp"

namespace apps {

/// Adds --limit-tag, --limit-tagged-frame, --limit-array-message, --limit-message, --limit-frames and --limit-parts to
/// `app`, each of which stores into `limits` when `app` parses; --help shows the values that `limits` holds now as the
/// defaults. Sizes are bytes, with an optional unit (KiB, MiB, GiB, TiB or the letter alone, in powers of 1024,
/// whatever the case). `limits` must outlive `app`.
void addLimitOptions(CLI::App& app, foundation::msg_svc::transport::layers::session::Limits& limits);

/// Adds one option in the group "Limits" that takes a size from `smallest` to `largest` and stores it into `bytes`,
/// whose present value is shown as the default. `bytes` must outlive `app`.
CLI::Option* addSizeOption(CLI::App& app, const std::string& name, std::uint64_t& bytes, const std::string& description,
                           std::uint64_t largest = std::numeric_limits<std::uint64_t>::max(),
                           std::uint64_t smallest = 1);

/// A size as addLimitOptions() describes it, in bytes; empty for anything else, for a sign and for what 64 bits cannot
/// hold.
std::optional<std::uint64_t> parseSize(std::string_view text);

/// Bytes as a person writes them: "64MiB" where a binary unit divides them, "1000" otherwise.
std::string sizeText(std::uint64_t bytes);

}  // namespace apps
