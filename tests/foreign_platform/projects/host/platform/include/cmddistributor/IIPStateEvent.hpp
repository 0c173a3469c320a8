// What becomes of requests. Immutable.
#pragma once

#include <string>

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"

namespace cmddistributor {

class IIPStateEvent : public foundation::msg_svc::eventmgr::BaseEvent {
  public:
    explicit IIPStateEvent(foundation::msg_svc::exchange::IDType of) : of_(of) {}

    foundation::msg_svc::exchange::IDType getRequestId() const { return of_; }

  private:
    foundation::msg_svc::exchange::IDType of_;
};

struct IIPStateEventTypes {
    static std::string getStartedEventType() { return "runs"; }
    static std::string getSuspendedEventType() { return "stands"; }
    static std::string getResumedEventType() { return "runs again"; }
    static std::string getDiscardedEventType() { return "dropped"; }
    static std::string getRequeuedEventType() { return "put back"; }
    static std::string getReactivatedEventType() { return "taken again"; }
    static std::string getCompletedEventType() { return "over"; }
    static std::string getLastEventType() { return "closed"; }
};

template <std::string (*TypeGetter)(), class Base>
class DefaultIIPStateEvent : public Base {
  public:
    explicit DefaultIIPStateEvent(const foundation::msg_svc::exchange::IDType& of) : Base(of) {}

    std::string type() const { return TypeGetter(); }
};

}  // namespace cmddistributor
