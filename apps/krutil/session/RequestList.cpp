#include "krutil/session/RequestList.hpp"

#include <algorithm>
#include <utility>

#include "cmddistributor/IIPStateEvent.hpp"
#include "krutil/io/PrintableErrorEvent.hpp"

namespace krutil_client {

RequestList::RequestList(foundation::msg_svc::eventmgr::EventMgr& events) {
    const auto leadsTo = [this, &events]<class EventT>(std::in_place_type_t<EventT>, SentRequest::State state) {
        events.subscribe<EventT>([this, state](const EventT& event) {
            if (const Sent request = find(event.getRequestId())) {
                request->state = state;
            }
        });
    };
    using State = SentRequest::State;
    leadsTo(std::in_place_type<cmddistributor::IIPStartedEvent>, State::Running);
    leadsTo(std::in_place_type<cmddistributor::IIPSuspendedEvent>, State::HeldUp);
    leadsTo(std::in_place_type<cmddistributor::IIPResumedEvent>, State::Running);
    leadsTo(std::in_place_type<cmddistributor::IIPDiscardedEvent>, State::Discarded);
    leadsTo(std::in_place_type<cmddistributor::IIPRequeuedEvent>, State::Requeued);
    leadsTo(std::in_place_type<cmddistributor::IIPReactivatedEvent>, State::Waiting);
    events.subscribe<krutil::io::PrintableErrorEvent>([this](const krutil::io::PrintableErrorEvent& event) {
        if (const Sent request = find(event.getRequestId())) {
            request->errorPrinted = true;
        }
    });
}

void RequestList::add(const Sent& request) {
    request->number = ++lastNumber_;
    requests_.push_back(request);
}

void RequestList::remove(const SentRequest& request) {
    std::erase_if(requests_, [&request](const Sent& each) { return each.get() == &request; });
}

RequestList::Sent RequestList::find(const foundation::msg_svc::exchange::IDType& id) const {
    const auto found =
        std::find_if(requests_.begin(), requests_.end(), [&id](const Sent& each) { return each->id == id; });
    return found == requests_.end() ? nullptr : *found;
}

RequestList::Sent RequestList::find(unsigned number) const {
    const auto found =
        std::find_if(requests_.begin(), requests_.end(), [number](const Sent& each) { return each->number == number; });
    return found == requests_.end() ? nullptr : *found;
}

}  // namespace krutil_client
