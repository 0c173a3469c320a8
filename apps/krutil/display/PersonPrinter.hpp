// A session for a person to read.
#pragma once

#include "krutil/base/Output.hpp"
#include "krutil/display/Printer.hpp"
#include "krutil/io/TextBase.hpp"

namespace krutil_client {

/// What a person wants to see.
struct PersonStyle {
    bool warningStack = false;  ///< where each warning was issued
    bool color = false;         ///< text on standard error is told apart by colour
    bool safeText = false;      ///< what came from the engine is shown as safeText() has it
};

/// Text goes to standard output or standard error as it arrives, byte for byte as UTF-8 unless the style wants safe
/// text; errors, warnings that are shown and timing go to standard error. An error is shown as the engine wants it
/// printed, or else as errorText() has it. Outputs of a function go to standard output, as arrayText() has them or as
/// the file that they are in. Files of pictures are named on standard error.
class PersonPrinter : public Printer {
  public:
    /// Both must outlive the object.
    PersonPrinter(Output& out, Output& err, PersonStyle style) noexcept : out_(out), err_(err), style_(style) {}

    void subscribe(foundation::msg_svc::eventmgr::EventMgr& events) override;
    void connected(const foundation::msg_svc::transport::layers::session::Peer& peer,
                   const std::unordered_map<std::string, std::string>& features) override;
    void returned(const Returned& output) override;
    void pictured(const Pictured& picture) override;
    void replied(const Replied& reply) override;
    void failed(int exitCode, const std::string& sentence) override;
    void timed(const Timing& timing) override;

  private:
    std::string shown(const std::string& text) const;
    void show(const krutil::io::TextBase& text);
    void complain(const char* color, const std::string& text);

    Output& out_;
    Output& err_;
    PersonStyle style_;
};

}  // namespace krutil_client
