#include "foundation/msg_svc/eventmgr/EventMgr.hpp"

#include <algorithm>
#include <stdexcept>

namespace foundation::msg_svc::eventmgr {

BaseEvent::~BaseEvent() = default;

EventMgr::Subscription EventMgr::subscribe(std::type_index type, Callback callback) {
    const std::lock_guard lock(mutex_);
    byType_[type].push_back({next_, std::make_shared<const Callback>(std::move(callback))});
    return next_++;
}

EventMgr::Subscription EventMgr::subscribeAll(Callback callback) {
    const std::lock_guard lock(mutex_);
    all_.push_back({next_, std::make_shared<const Callback>(std::move(callback))});
    return next_++;
}

void EventMgr::unsubscribe(Subscription subscription) {
    const auto ended = [subscription](const Subscriber& subscriber) { return subscriber.id == subscription; };
    const std::lock_guard lock(mutex_);
    std::erase_if(all_, ended);
    for (auto& [type, subscribers] : byType_) {
        std::erase_if(subscribers, ended);
    }
}

void EventMgr::publish(const boost::shared_ptr<const BaseEvent>& event) const {
    if (!event) {
        throw std::invalid_argument("EventMgr::publish: expected an event, got a null pointer");
    }
    const BaseEvent& published = *event;
    // Callbacks run without the lock, so that they may subscribe, unsubscribe and publish.
    std::vector<std::shared_ptr<const Callback>> callbacks;
    {
        const std::lock_guard lock(mutex_);
        if (const auto found = byType_.find(typeid(published)); found != byType_.end()) {
            for (const auto& subscriber : found->second) {
                callbacks.push_back(subscriber.callback);
            }
        }
        for (const auto& subscriber : all_) {
            callbacks.push_back(subscriber.callback);
        }
    }
    for (const auto& callback : callbacks) {
        (*callback)(event);
    }
}

}  // namespace foundation::msg_svc::eventmgr
