#include "krutil/io/PrintableErrorEvent.hpp"

namespace krutil::io {

PrintableErrorEvent::PrintableErrorEvent(foundation::msg_svc::exchange::IDType id,
                                         ::cmddistributor::RuntimeException exception, std::u16string text)
    : RequestIdAdapter(id), exception_(std::move(exception)), text_(std::move(text)) {}

PrintableErrorEvent::~PrintableErrorEvent() = default;

}  // namespace krutil::io
