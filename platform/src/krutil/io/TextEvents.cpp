#include "krutil/io/SinkTextEvent.hpp"
#include "krutil/io/TextBaseEvent.hpp"

namespace krutil::io {

TextBase::~TextBase() = default;

TextBaseEvent::TextBaseEvent(foundation::msg_svc::exchange::IDType id, StreamTypeEnum streamType, std::u16string text)
    : TextBase(streamType, std::move(text)), RequestIdAdapter(id) {}

TextBaseEvent::~TextBaseEvent() = default;

SinkTextEvent::SinkTextEvent(foundation::msg_svc::exchange::IDType id, StreamTypeEnum streamType, std::u16string text)
    : TextBase(streamType, std::move(text)), RequestIdAdapter(id) {}

SinkTextEvent::~SinkTextEvent() = default;

}  // namespace krutil::io
