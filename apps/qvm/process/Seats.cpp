#include "qvm/process/Seats.hpp"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "qvm/process/Seat.hpp"

namespace qvm {
namespace {

// The line has room for the few words that are ever said on it. A process that has ended needs none.
void say(int line, char word) {
    static_cast<void>(::send(line, &word, 1, MSG_NOSIGNAL | MSG_DONTWAIT));
}

}  // namespace

void Seats::add(pid_t process, foundation::core::posix::OwnedDescriptor line) {
    unfinished_.push_back({process, std::move(line), Clock::now(), std::nullopt});
}

void Seats::remove(pid_t process) {
    sessions_.erase(process);
    unfinished_.remove_if([process](const Handshake& each) { return each.process == process; });
}

void Seats::forget() noexcept {
    unfinished_.clear();
    sessions_.clear();
}

std::size_t Seats::seated() const {
    return sessions_.size() +
           static_cast<std::size_t>(std::count_if(unfinished_.begin(), unfinished_.end(), [](const Handshake& each) {
               return each.seated && !each.withdrawn;
           }));
}

// The oldest handshake that has a seat and whose client has not answered for a while.
std::list<Seats::Handshake>::iterator Seats::findStalled(Clock::time_point now) {
    return std::find_if(unfinished_.begin(), unfinished_.end(), [now](const Handshake& each) {
        return each.seated && !each.withdrawn && now - *each.seated >= answerGrace;
    });
}

bool Seats::areTaken(Clock::time_point now) {
    return seated() >= maxSessions_ && findStalled(now) == unfinished_.end();
}

std::optional<Seats::Clock::time_point> Seats::nextWithdrawal() const {
    if (std::any_of(unfinished_.begin(), unfinished_.end(), [](const Handshake& each) { return each.withdrawn; })) {
        return std::nullopt;
    }
    return unfinished_.front().begin + grace;
}

void Seats::withdrawOldest() {
    withdraw(unfinished_.front());
}

void Seats::withdraw(Handshake& handshake) {
    handshake.withdrawn = true;
    say(handshake.line.get(), seat_words::withdraw);
}

std::vector<std::string> Seats::answer(Clock::time_point now) {
    std::vector<std::string> refusals;
    for (auto each = unfinished_.begin(); each != unfinished_.end();) {
        char word = 0;
        const ssize_t count = each->line ? ::recv(each->line.get(), &word, 1, MSG_DONTWAIT) : -1;
        if (count == 1 && !each->withdrawn) {
            giveSeat(*each, now, refusals);
        } else if (count == 0 || (count < 0 && errno != EAGAIN && errno != EINTR)) {
            // A line that fails would be reported as readable for ever.
            each->line.reset();
        }
        if (each->seated && !each->line) {
            sessions_.insert(each->process);
            each = unfinished_.erase(each);
        } else {
            ++each;
        }
    }
    return refusals;
}

void Seats::giveSeat(Handshake& handshake, Clock::time_point now, std::vector<std::string>& refusals) {
    if (seated() >= maxSessions_) {
        const auto stalled = findStalled(now);
        if (stalled == unfinished_.end()) {
            refusals.push_back(std::to_string(maxSessions_) + " sessions are open (--max-sessions)");
            say(handshake.line.get(), seat_words::full);
            return;
        }
        refusals.emplace_back("it had a place among the sessions, and did not finish its handshake");
        withdraw(*stalled);
    }
    handshake.seated = now;
    say(handshake.line.get(), seat_words::yes);
}

void Seats::appendTo(std::vector<pollfd>& watched) const {
    for (const Handshake& each : unfinished_) {
        watched.push_back({each.line.get(), POLLIN, 0});
    }
}

std::set<pid_t> Seats::processes() const {
    std::set<pid_t> all = sessions_;
    for (const Handshake& each : unfinished_) {
        all.insert(each.process);
    }
    return all;
}

}  // namespace qvm
