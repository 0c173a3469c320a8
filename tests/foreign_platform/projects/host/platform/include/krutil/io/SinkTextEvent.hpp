// Text that is shown for a request. Immutable.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "krutil/io/TextBase.hpp"

namespace krutil::io {

class SinkTextEvent : public ::cmddistributor::RequestIdAdapter,
                      public foundation::msg_svc::eventmgr::BaseEvent,
                      public TextBase {
  public:
    SinkTextEvent(foundation::msg_svc::exchange::IDType id, StreamTypeEnum kind, std::u16string text)
        : RequestIdAdapter(id), TextBase(kind, std::move(text)) {}
};

}  // namespace krutil::io
