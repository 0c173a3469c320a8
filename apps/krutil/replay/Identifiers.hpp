// Identifiers of requests, which are others in each session.
#pragma once

#include <cstdint>
#include <map>
#include <utility>

#include "krutil/replay/Talk.hpp"

namespace krutil_client {

/// Which identifier of a client stands for which one of a recording. Not synchronised.
class Identifiers {
  public:
    /// Takes identifiers that are in the same places of both messages for the same, unless one of the two stands for
    /// another one already.
    void match(const Said& recorded, const Said& said);

    /// A recorded message with the client's identifiers. Those without a partner stay as they are.
    Said forClient(Said recorded) const { return translated(std::move(recorded), toClient_); }

    /// A client's message with the recorded identifiers.
    Said asRecorded(Said said) const { return translated(std::move(said), toRecorded_); }

  private:
    using Number = std::pair<std::uint64_t, std::uint64_t>;  ///< upper and lower half

    static Said translated(Said said, const std::map<Number, Number>& others);

    std::map<Number, Number> toClient_;
    std::map<Number, Number> toRecorded_;
};

}  // namespace krutil_client
