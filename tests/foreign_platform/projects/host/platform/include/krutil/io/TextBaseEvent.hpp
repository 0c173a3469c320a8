// Text that a request printed. Immutable.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "krutil/io/TextBase.hpp"

namespace krutil::io {

class TextBaseEvent : public TextBase,
                      public ::cmddistributor::RequestIdAdapter,
                      public foundation::msg_svc::eventmgr::BaseEvent {
  public:
    TextBaseEvent(foundation::msg_svc::exchange::IDType id, StreamTypeEnum kind, std::u16string text)
        : TextBase(kind, std::move(text)), RequestIdAdapter(id) {}
};

}  // namespace krutil::io
