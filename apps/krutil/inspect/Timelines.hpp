// What happened to each request of a recording, and when.
#pragma once

#include <cstdint>
#include <string>
#include <unordered_map>

#include "krutil/inspect/InspectedMessage.hpp"

namespace krutil_client {

/// Collects the messages of each request, from the one that begins it to its reply. Messages of one type that follow
/// each other are one line, so that a request that prints without end takes no memory for it. Not synchronised.
class Timelines {
  public:
    /// Adds a message. Returns the timeline of its request when this is the request's reply, and nothing else:
    ///
    ///     request f24ed6470b9819ff0f6bc443a996bb0a: eval "print(1)"
    ///        +0.000000 --> IIPEnqueueMessage, 131 bytes
    ///        +0.000310 <-- IIPStartedEvent, 63 bytes
    std::string take(const InspectedMessage& message);

    /// The timelines of requests without a reply, in the order of their beginning.
    std::string rest();

  private:
    struct Timeline {
        std::uint64_t begin = 0;
        std::string text;  ///< lines that are complete
        std::string line;  ///< of the last messages, without their number and size
        std::string type;
        std::uint64_t messages = 0;
        std::uint64_t bytes = 0;
    };

    static void endLine(Timeline& timeline);

    std::unordered_map<std::string, Timeline> open_;  ///< by session and request
};

}  // namespace krutil_client
