// Text that a request printed.
#pragma once

#include <string>

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "krutil/io/TextBase.hpp"

namespace krutil::io {

/// Text as running code wrote it. Immutable.
class TextBaseEvent : public foundation::msg_svc::eventmgr::BaseEvent,
                      public TextBase,
                      public ::cmddistributor::RequestIdAdapter {
  public:
    /// `id` is that of the request; the default one for text of none.
    TextBaseEvent(foundation::msg_svc::exchange::IDType id, StreamTypeEnum streamType, std::u16string text);
    ~TextBaseEvent() override;
};

}  // namespace krutil::io
