// Sets of capabilities.
#pragma once

#include <cstdint>
#include <deque>

namespace capabilities {

enum class Capability : std::uint64_t { line, panes, richPanes, neighbour, pages, questions, steps };

class CapabilityList {
  public:
    CapabilityList& operator|=(const Capability& capability) {
        word_ |= std::uint64_t{1} << static_cast<std::uint64_t>(capability);
        return *this;
    }

    /// The highest number first.
    std::deque<Capability> getEnabledCapabilitySequence() const {
        std::deque<Capability> sequence;
        for (std::uint64_t number = 0; number < 64; ++number) {
            if (((word_ >> number) & 1) != 0) {
                sequence.push_front(static_cast<Capability>(number));
            }
        }
        return sequence;
    }

    bool operator==(const CapabilityList&) const = default;

  private:
    std::uint64_t word_ = 0;
};

}  // namespace capabilities
