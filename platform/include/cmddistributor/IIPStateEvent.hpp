// What became of a request.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace cmddistributor {

/// Base of the state events. Immutable.
class IIPStateEvent : public foundation::msg_svc::eventmgr::BaseEvent, public RequestIdAdapter {
  public:
    explicit IIPStateEvent(const foundation::msg_svc::exchange::IDType& id) noexcept : RequestIdAdapter(id) {}
    ~IIPStateEvent() override;

    /// The kind's type string; every concrete kind has its own.
    virtual const char* getType() const noexcept = 0;
};

/// Type strings of the kinds of state events.
struct IIPStateEventTypes {
    static const char* getStartedEventType();
    static const char* getSuspendedEventType();
    static const char* getResumedEventType();
    static const char* getDiscardedEventType();
    static const char* getRequeuedEventType();
    static const char* getReactivatedEventType();
    static const char* getCompletedEventType();
    static const char* getLastEventType();
};

/// One kind of state event: `TypeGetter` names it, `Base` is what it is besides.
template <const char* (*TypeGetter)(), class Base>
class DefaultIIPStateEvent : public Base {
  public:
    explicit DefaultIIPStateEvent(const foundation::msg_svc::exchange::IDType& id) noexcept : Base(id) {}
    const char* getType() const noexcept override { return TypeGetter(); }
};

using IIPStartedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getStartedEventType, IIPStateEvent>;
using IIPSuspendedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getSuspendedEventType, IIPStateEvent>;
using IIPResumedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getResumedEventType, IIPStateEvent>;
using IIPDiscardedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getDiscardedEventType, IIPStateEvent>;
using IIPRequeuedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getRequeuedEventType, IIPStateEvent>;
using IIPReactivatedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getReactivatedEventType, IIPStateEvent>;
using IIPCompletedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getCompletedEventType, IIPStateEvent>;

namespace detail {
/// The last event of a request is a completed event too; whoever counts looks at exact types.
using LastIIPEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getLastEventType, IIPCompletedEvent>;
}  // namespace detail
using detail::LastIIPEvent;

}  // namespace cmddistributor
