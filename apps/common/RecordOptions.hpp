// Command-line options for recordings.
#pragma once

#include <CLI/CLI.hpp>

#include "common/Recording.hpp"

namespace apps {

/// Adds --record, --record-snap and --record-size to `app`, in this group of its help; `fileText` describes the first.
/// They store into `options` when `app` parses, which must outlive `app`.
void addRecordOptions(CLI::App& app, RecordOptions& options, const std::string& group, const std::string& fileText);

}  // namespace apps
