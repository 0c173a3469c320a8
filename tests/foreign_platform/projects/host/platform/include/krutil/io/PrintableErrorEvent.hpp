// An error and the text to show for it. Immutable.
#pragma once

#include <string>

#include "cmddistributor/RequestIdAdapter.hpp"
#include "cmddistributor/RuntimeException.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace krutil::io {

class PrintableErrorEvent : public ::cmddistributor::RequestIdAdapter, public foundation::msg_svc::eventmgr::BaseEvent {
  public:
    PrintableErrorEvent(foundation::msg_svc::exchange::IDType id, ::cmddistributor::RuntimeException error,
                        std::u16string text)
        : RequestIdAdapter(id), content_(std::move(error), std::move(text)) {}

    ::cmddistributor::RuntimeException getException() const { return content_.first; }
    std::u16string getText() const { return content_.second; }

  private:
    std::pair<::cmddistributor::RuntimeException, std::u16string> content_;
};

}  // namespace krutil::io
