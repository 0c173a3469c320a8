// A set of capabilities.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <string>
#include <vector>

#include "capabilities/Capability.hpp"

namespace capabilities {

/// One 64-bit word, a bit for each capability. A value; copies are independent.
class CapabilityList {
  public:
    /// The empty set.
    constexpr CapabilityList() noexcept = default;
    /// The set of `members`. Throws std::out_of_range for a number above 63.
    CapabilityList(std::initializer_list<Capability> members);

    /// Adds one capability. Throws std::out_of_range for a number above 63, which the word has no bit for.
    CapabilityList& operator|=(const Capability& capability);

    /// Whether the capability is in the set; false for every number above 63.
    bool contains(Capability capability) const noexcept;

    /// Members of this set that `other` lacks.
    CapabilityList without(const CapabilityList& other) const noexcept;

    /// Whether there is no capability in the set.
    bool empty() const noexcept { return bits_ == 0; }

    /// The members in ascending order of their numbers.
    std::vector<Capability> getEnabledCapabilitySequence() const;

    bool operator==(const CapabilityList&) const noexcept = default;  ///< the same members

  private:
    std::uint64_t bits_ = 0;
};

/// Name of a capability as the wire spells it, or its number in decimal when it has no name.
std::string toString(Capability capability);

/// The members' names, separated by ", "; "none" for the empty set.
std::string toString(const CapabilityList& list);

}  // namespace capabilities
