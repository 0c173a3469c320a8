// An error to be shown to the user.
#pragma once

#include <string>

#include "cmddistributor/RequestIdAdapter.hpp"
#include "cmddistributor/RuntimeException.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace krutil::io {

/// The error of a request together with the text to print for it. Immutable.
class PrintableErrorEvent : public foundation::msg_svc::eventmgr::BaseEvent, public ::cmddistributor::RequestIdAdapter {
  public:
    /// `id` is that of the request; `text` is what is to be printed.
    PrintableErrorEvent(foundation::msg_svc::exchange::IDType id, ::cmddistributor::RuntimeException exception,
                        std::u16string text);
    ~PrintableErrorEvent() override;

    /// The error as a record. Valid as long as the event.
    const ::cmddistributor::RuntimeException& getException() const noexcept { return exception_; }
    /// UTF-16.
    const std::u16string& getText() const noexcept { return text_; }

  private:
    ::cmddistributor::RuntimeException exception_;
    std::u16string text_;
};

}  // namespace krutil::io
