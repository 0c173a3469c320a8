// How a client has left: what it has said last.
//
//     relay.record();
//     ...  // the whole session
//     EXPECT_EQ(programs_test::wrongGoodbye(relay.recorded(Relay::Way::ToEngine), 1), "");
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace programs_test {

/// How often `text` has `part`.
inline std::size_t countOf(std::string_view text, std::string_view part) {
    std::size_t count = 0;
    for (auto found = text.find(part); found != std::string_view::npos; found = text.find(part, found + 1)) {
        ++count;
    }
    return count;
}

/// What is wrong with `said`, all that a client has sent to an engine: it ends with the goodbye, which nothing follows,
/// and has so many cancels before. Empty for nothing.
inline std::string wrongGoodbye(const std::string& said, std::size_t cancels) {
    constexpr std::size_t headerBytes = 24;
    const std::string goodbye = '\3' + std::string(headerBytes - 1, '\0');
    if (!said.ends_with(goodbye)) {
        return "the goodbye is not the last of " + std::to_string(said.size()) + " bytes that were sent";
    }
    const std::size_t found = countOf(said, "krutil:IIPCancelMessage");
    return found == cancels ? std::string()
                            : std::to_string(found) + " cancels precede the goodbye, not " + std::to_string(cancels);
}

}  // namespace programs_test
