#include "capabilities/CapabilityList.hpp"

#include <array>
#include <stdexcept>

namespace capabilities {

CapabilityList::CapabilityList(std::initializer_list<Capability> members) {
    for (const Capability capability : members) {
        *this |= capability;
    }
}

CapabilityList& CapabilityList::operator|=(const Capability& capability) {
    const auto number = static_cast<std::uint64_t>(capability);
    if (number > 63) {
        throw std::out_of_range("CapabilityList: expected a capability from 0 to 63, got " + std::to_string(number));
    }
    bits_ |= std::uint64_t{1} << number;
    return *this;
}

bool CapabilityList::contains(Capability capability) const noexcept {
    const auto number = static_cast<std::uint64_t>(capability);
    return number <= 63 && (bits_ >> number & 1) != 0;
}

CapabilityList CapabilityList::without(const CapabilityList& other) const noexcept {
    CapabilityList rest;
    rest.bits_ = bits_ & ~other.bits_;
    return rest;
}

std::vector<Capability> CapabilityList::getEnabledCapabilitySequence() const {
    std::vector<Capability> sequence;
    for (std::uint64_t number = 0; number <= 63; ++number) {
        if ((bits_ >> number & 1) != 0) {
            sequence.push_back(static_cast<Capability>(number));
        }
    }
    return sequence;
}

std::string toString(Capability capability) {
    static constexpr std::array<const char*, 7> names{
        "InteractiveCommandLine", "Swing", "ComplexSwing", "LocalClient", "WebWindow", "ModalDialogs", "Debugging"};
    const auto number = static_cast<std::uint64_t>(capability);
    return number < names.size() ? names[number] : std::to_string(number);
}

std::string toString(const CapabilityList& list) {
    std::string text;
    for (const Capability capability : list.getEnabledCapabilitySequence()) {
        text += (text.empty() ? "" : ", ") + toString(capability);
    }
    return text.empty() ? "none" : text;
}

}  // namespace capabilities
