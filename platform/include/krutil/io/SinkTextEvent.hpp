// Text that the engine shows on a request's behalf.
#pragma once

#include <string>

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "krutil/io/TextBase.hpp"

namespace krutil::io {

/// Text for the request's sink: the shown value of an expression, or the echo of the command. Immutable.
class SinkTextEvent : public foundation::msg_svc::eventmgr::BaseEvent,
                      public TextBase,
                      public ::cmddistributor::RequestIdAdapter {
  public:
    /// `id` is that of the request; the default one for text of none.
    SinkTextEvent(foundation::msg_svc::exchange::IDType id, StreamTypeEnum streamType, std::u16string text);
    ~SinkTextEvent() override;
};

}  // namespace krutil::io
