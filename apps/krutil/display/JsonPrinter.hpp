// A session for a program to read.
#pragma once

#include <nlohmann/json_fwd.hpp>

#include "krutil/base/Output.hpp"
#include "krutil/display/Printer.hpp"

namespace krutil_client {

/// One JSON object a line on standard output, in the order in which things happened. "event" says what it is:
///
///   connected                     "engine", "features" {name: value}, "capabilities" [name]
///   started suspended resumed discarded requeued reactivated completed last
///                                 "request"
///   text                          "request", "stream" (output, error, generic), "text": what the code wrote
///   value                         the same: the shown value of an expression, or the echo of the code
///   warning                       "request", "shown" (false for the first event of each warning, hidden or not; true
///                                 for the second one of those that are shown), "id", "message", "format", "arguments"
///                                 [number or text], "stack" [{"file", "function", "line"}], "hidden" (by a filter),
///                                 "time" (days since the first of January of year 0, which is day 1)
///   error                         "request", "text" to print, "error": before the reply with the same error
///   loop                          "request", "state" (enter, exit), "loop" (input, debug, keyboard, pause, or another
///                                 prompt's name): a prompt opens or closes
///   capabilities                  "previous", "engine", "client", "request", each [name]
///   output                        "request", "number" (from 1), "type", "dimensions", "order" (row-major or
///                                 column-major: how it lies in memory), "file" if it was written to one; else "text"
///                                 if it is one, or "elements" if they are few: nested lists by index, whatever the
///                                 order, complex numbers as [real, imaginary], numbers that JSON does not know as
///                                 "nan", "inf" and "-inf"
///   picture                       "number" of the line that announced it, "type" (image/png, image/svg+xml,
///                                 text/html), "width" and "height" of a PNG, "file" that it was written to: once for
///                                 each form of a picture, after the reply to the request that showed it
///   reply                         "request", "ok", "error" (absent when ok)
///   shutdown
///   timing                        "readyMs", "firstOutputMs", "answeredMs", as far as known
///   failure                       "exitCode", "text": the session failed
///
/// "request" is 32 hexadecimal digits, all 0 for none. An error has "status", "id", "message", "function", "frames"
/// [{"file", "function", "line"}] and "causes" [error]. Text that is not valid UTF-8 shows U+FFFD.
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
