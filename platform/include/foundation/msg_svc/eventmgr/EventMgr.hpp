// Publishing events to those who asked for their type.
#pragma once

#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <typeindex>
#include <unordered_map>
#include <vector>

#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"

namespace foundation::msg_svc::eventmgr {

/// Delivers each published event to the subscribers of its exact dynamic type, then to those of every event; a
/// subscriber of a base class does not see derived events, so one event is never counted twice. Delivery happens on the
/// publishing thread, in the order of subscription. All members may be called from any thread, from inside a callback
/// too; a subscriber removed while an event is being delivered may still see that one event.
class EventMgr {
  public:
    /// Names a subscription; no number is used twice.
    using Subscription = std::uint64_t;
    /// What is called with an event. The event may be kept.
    using Callback = std::function<void(const boost::shared_ptr<const BaseEvent>&)>;

    /// Calls `callback` with each event whose dynamic type is exactly `EventT`.
    template <class EventT>
    Subscription subscribe(std::function<void(const EventT&)> callback) {
        return subscribe(std::type_index(typeid(EventT)),
                         [callback = std::move(callback)](const boost::shared_ptr<const BaseEvent>& event) {
                             callback(dynamic_cast<const EventT&>(*event));
                         });
    }

    /// Calls `callback` with each event whose dynamic type is exactly `type`.
    Subscription subscribe(std::type_index type, Callback callback);

    /// Calls `callback` with every event.
    Subscription subscribeAll(Callback callback);

    /// Ends a subscription; an unknown one is ignored.
    void unsubscribe(Subscription subscription);

    /// Delivers `event` before returning. An exception of a subscriber ends the delivery and reaches the caller. Throws
    /// std::invalid_argument for a null pointer.
    void publish(const boost::shared_ptr<const BaseEvent>& event) const;

  private:
    struct Subscriber {
        Subscription id;
        std::shared_ptr<const Callback> callback;
    };

    mutable std::mutex mutex_;
    std::unordered_map<std::type_index, std::vector<Subscriber>> byType_;
    std::vector<Subscriber> all_;
    Subscription next_ = 1;
};

}  // namespace foundation::msg_svc::eventmgr
