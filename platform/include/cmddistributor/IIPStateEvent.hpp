// What became of a request.
#pragma once

#include "cmddistributor/RequestIdAdapter.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace cmddistributor {

/// Base of the state events. Immutable.
class IIPStateEvent : public foundation::msg_svc::eventmgr::BaseEvent, public RequestIdAdapter {
  public:
    /// `id` is that of the request.
    explicit IIPStateEvent(const foundation::msg_svc::exchange::IDType& id) noexcept : RequestIdAdapter(id) {}
    ~IIPStateEvent() override;

    /// The kind's type string; every concrete kind has its own.
    virtual const char* getType() const noexcept = 0;
};

/// Type strings of the kinds of state events.
struct IIPStateEventTypes {
    static const char* getStartedEventType();      ///< of IIPStartedEvent
    static const char* getSuspendedEventType();    ///< of IIPSuspendedEvent
    static const char* getResumedEventType();      ///< of IIPResumedEvent
    static const char* getDiscardedEventType();    ///< of IIPDiscardedEvent
    static const char* getRequeuedEventType();     ///< of IIPRequeuedEvent
    static const char* getReactivatedEventType();  ///< of IIPReactivatedEvent
    static const char* getCompletedEventType();    ///< of IIPCompletedEvent
    static const char* getLastEventType();         ///< of LastIIPEvent
};

/// One kind of state event: `TypeGetter` names it, `Base` is what it is besides.
template <const char* (*TypeGetter)(), class Base>
class DefaultIIPStateEvent : public Base {
  public:
    /// `id` is that of the request.
    explicit DefaultIIPStateEvent(const foundation::msg_svc::exchange::IDType& id) noexcept : Base(id) {}
    /// What `TypeGetter` returns.
    const char* getType() const noexcept override { return TypeGetter(); }
};

/// The queue has handed the request out.
using IIPStartedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getStartedEventType, IIPStateEvent>;
/// A prompt holds the request up.
using IIPSuspendedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getSuspendedEventType, IIPStateEvent>;
/// The prompt has closed, and the request goes on.
using IIPResumedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getResumedEventType, IIPStateEvent>;
/// The request will not run.
using IIPDiscardedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getDiscardedEventType, IIPStateEvent>;
/// The prompt that had taken the request closed before its turn: it is in the queue again.
using IIPRequeuedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getRequeuedEventType, IIPStateEvent>;
/// The request was taken from the queue again after it had been requeued.
using IIPReactivatedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getReactivatedEventType, IIPStateEvent>;
/// The code came to its end, with success or an error.
using IIPCompletedEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getCompletedEventType, IIPStateEvent>;

namespace detail {
/// The last event of a request is a completed event too; whoever counts looks at exact types.
using LastIIPEvent = DefaultIIPStateEvent<&IIPStateEventTypes::getLastEventType, IIPCompletedEvent>;
}  // namespace detail
using detail::LastIIPEvent;

}  // namespace cmddistributor
