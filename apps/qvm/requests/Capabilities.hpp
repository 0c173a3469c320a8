// What the two ends of a session can do, as they state it.
#pragma once

#include <mutex>
#include <string>

#include "capabilities/CapabilityList.hpp"

namespace qvm {

/// The two lists. A capability is in force when both have it. Members may be called from any thread.
class Capabilities {
  public:
    using List = ::capabilities::CapabilityList;

    struct Lists {
        List inForce;
        List engine;
        List client;
    };

    explicit Capabilities(const List& engine) : engine_(engine) {}

    Lists lists() const;

    /// Replaces what the client states.
    void setClient(const List& client);

    /// Adds a capability to what the engine states, or takes it away.
    void setEngine(::capabilities::Capability capability, bool on);

    /// A sentence about those of `needed` that the engine or the client lacks; empty when both have all.
    std::string lacking(const List& needed) const;

  private:
    mutable std::mutex mutex_;
    List engine_;
    List client_;
};

}  // namespace qvm
