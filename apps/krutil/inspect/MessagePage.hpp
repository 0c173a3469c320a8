// The messages of a recording as one page for a browser.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "common/RecordingReader.hpp"
#include "krutil/inspect/InspectedMessage.hpp"

namespace krutil_client {

/// Collects messages, and writes a page that shows them: requests as lanes on an axis of time, messages as marks on
/// them, and both as tables. The page needs no other file and no network; its policy forbids the browser to use any,
/// and to run code other than the page's own. Whatever the recording says is escaped. Not synchronised.
///
///     MessagePage page;
///     page.take(message, begin, true);
///     std::string html = page.html(reader.sessions(), "session.pcapng", {});
class MessagePage {
  public:
    /// So many messages have a place on the page. The page says which ones it leaves out.
    static constexpr std::uint64_t mostMessages = 10'000;

    /// Takes the next message of the recording, `begin` being the time 0 in nanoseconds since 1970. One that is not
    /// `wanted` is not shown; it is looked at all the same, because other messages of its request tell how much later
    /// than that they came.
    void take(const InspectedMessage& message, std::uint64_t begin, bool wanted);

    /// The page, in UTF-8. `sessions` are those that messages refer to. `file` is what the page calls the recording,
    /// any bytes. `notes` are sentences that it begins with, in UTF-8.
    std::string html(const std::vector<apps::RecordedSession>& sessions, std::string_view file,
                     std::vector<std::string> notes) const;

  private:
    // The message that began a request.
    struct Beginning {
        std::uint64_t nanoseconds = 0;
        std::string gist;
    };

    // A request with a message on the page, or what belongs to no request of a session.
    struct Lane {
        std::size_t session = 0;
        std::string request;                 ///< identifier; empty for none
        std::optional<Beginning> beginning;  ///< empty for none, and where the recording does not have it
        std::string answered;                ///< seconds since the beginning; empty without a reply
        std::string outcome;                 ///< what the reply says
        std::uint64_t messages = 0;          ///< on the page
        std::uint64_t bytes = 0;             ///< of these
    };

    std::size_t laneOf(const InspectedMessage& message, const std::string& key);
    void add(const InspectedMessage& message, std::uint64_t begin, const std::string& key, const std::string& gist);
    std::string laneRows(const std::vector<apps::RecordedSession>& sessions) const;

    std::uint64_t begin_ = 0;
    std::unordered_map<std::string, Beginning> open_;           ///< requests without a reply, by session and identifier
    std::unordered_map<std::string, std::size_t> laneNumbers_;  ///< by the same
    std::vector<Lane> lanes_;
    std::string messageRows_;
    std::uint64_t messages_ = 0;  ///< on the page
    std::uint64_t leftOut_ = 0;   ///< wanted, without a place
    std::uint64_t firstLeftOut_ = 0;
    std::uint64_t lastLeftOut_ = 0;
};

}  // namespace krutil_client
