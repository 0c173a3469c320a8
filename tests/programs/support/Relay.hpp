// A network between a client and an engine that can be slow, silent and cut.
#pragma once

#include <array>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>

namespace programs_test {

/// Listens at one Unix socket and passes what its one client says on to another one, and back. When one of the two ends
/// has gone, what it has said passes yet, and then the stream to the other is closed. All members are for the test's
/// thread.
class Relay {
  public:
    enum class Way { ToEngine, ToClient };

    /// Listens at `path`, and connects to `engine` when a client has come.
    Relay(const std::string& path, const std::string& engine);

    /// Cuts.
    ~Relay();
    Relay(const Relay&) = delete;
    Relay& operator=(const Relay&) = delete;

    const std::string& path() const noexcept { return path_; }

    /// Passes this many bytes at a time at most.
    void passInPieces(std::size_t bytes);

    /// Passes this many bytes in all, and holds back the rest.
    void passAtMost(Way way, std::uint64_t bytes);
    void passAll(Way way) { passAtMost(way, ~std::uint64_t{0}); }

    /// Passes nothing more.
    void hold(Way way);

    /// Keeps what passes from now on. For sessions of little text.
    void record();

    /// What has passed since record().
    std::string recorded(Way way);

    /// Passes all up to the end of the next tagged frame with this tag, and holds back the rest. After record().
    void holdAfterFrame(Way way, const std::string& tag);

    /// Waits until all that may pass has; fails the test when its patience is over.
    void waitUntilHeld(Way way);

    /// Closes the streams to both ends; what has passed arrives.
    void cut();

    /// Ends one direction only.
    void end(Way way);

  private:
    struct Direction {
        std::uint64_t limit = ~std::uint64_t{0};
        std::uint64_t passed = 0;
        std::string recorded{};
        std::string lastTag{};     ///< of the frame that is the last one to pass; empty for none
        std::size_t lookFrom = 0;  ///< in what was recorded, for that frame
        int wake = -1;             ///< an eventfd, for a change of the limit and for the cut
    };

    Direction& direction(Way way) { return directions_[static_cast<std::size_t>(way)]; }
    void acceptAndPass();
    void pass(Way way, int from, int to);
    std::size_t allowed(Way way);
    std::size_t look(Way way, std::string_view waiting);

    const std::string path_;
    const std::string enginePath_;
    int listening_ = -1;

    std::mutex mutex_;
    std::condition_variable passed_;
    std::array<Direction, 2> directions_;
    std::size_t piece_ = 1U << 16;
    int client_ = -1;
    int engine_ = -1;
    bool cut_ = false;
    bool recording_ = false;

    std::thread thread_;
};

}  // namespace programs_test
