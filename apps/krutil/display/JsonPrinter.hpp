// A session for a program to read.
#pragma once

#include <nlohmann/json_fwd.hpp>

#include "krutil/base/Output.hpp"
#include "krutil/display/Printer.hpp"

namespace krutil_client {

/// One JSON object a line on standard output, in the order in which things happened. "event" says what it is.
/// krutil-events.schema.json, beside this file, says what each has, and docs/json-output.md when each comes. Text that
/// is not valid UTF-8 shows U+FFFD.
class JsonPrinter : public Printer {
  public:
    /// `out` must outlive the object.
    explicit JsonPrinter(Output& out) noexcept : out_(out) {}

    void subscribe(foundation::msg_svc::eventmgr::EventMgr& events) override;
    void connected(const foundation::msg_svc::transport::layers::session::Peer& peer,
                   const std::unordered_map<std::string, std::string>& features) override;
    void returned(const Returned& output) override;
    void pictured(const Pictured& picture) override;
    void replied(const Replied& reply) override;
    void failed(int exitCode, const std::string& sentence) override;
    void timed(const Timing& timing) override;

  private:
    void print(const nlohmann::ordered_json& object);

    Output& out_;
};

}  // namespace krutil_client
