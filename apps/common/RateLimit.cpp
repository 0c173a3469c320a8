#include "common/RateLimit.hpp"

#include <utility>

namespace apps {

std::optional<std::size_t> RateLimit::ask(Clock::time_point now) {
    const std::lock_guard lock(mutex_);
    if (!begin_ || now - *begin_ >= period_) {
        begin_ = now;
        said_ = 0;
    }
    if (said_ == lines_) {
        ++leftOut_;
        return std::nullopt;
    }
    ++said_;
    return std::exchange(leftOut_, 0);
}

}  // namespace apps
