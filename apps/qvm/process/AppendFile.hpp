// A file that text is added to: the diary and the engine's log.
#pragma once

#include <atomic>
#include <cstddef>
#include <functional>
#include <string>
#include <string_view>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace qvm {

namespace posix = foundation::core::posix;

/// Several processes may append to one file; each append is one write. May be used from any thread.
///
/// A full disk loses text, because output must not stop for the copy's sake. The first loss is told at once, finish()
/// tells how much was lost. When there is room again, what follows is kept, and begins a line.
class AppendFile {
  public:
    /// Tells a person a sentence. Called from any thread that appends; must not throw.
    using Complain = std::function<void(const std::string& sentence)>;

    /// Opens or creates the file as apps::openOwnFile() does. An empty path makes an object that drops what it is
    /// given. Throws std::runtime_error when the file cannot be opened or is not this user's.
    AppendFile(const std::string& path, Complain complain);

    explicit operator bool() const noexcept { return static_cast<bool>(descriptor_); }

    /// Adds `text`, or as much of it as fits.
    void append(std::string_view text) noexcept;

    /// Tells how many bytes were lost, if any and not told before. Returns whether the file has all. For the end.
    bool finish() noexcept;

    /// Losses count from here: those so far are told by another process, from which this one was forked.
    void startOver() noexcept;

  private:
    std::size_t write(std::string_view text) noexcept;
    void lose(std::size_t bytes) noexcept;

    const std::string path_;
    const Complain complain_;
    posix::OwnedDescriptor descriptor_;
    std::atomic<bool> withinLine_{false};  ///< the last byte that was written is no newline
    std::atomic<bool> gap_{false};         ///< the last text was not written, or not all of it
    std::atomic<std::size_t> lost_{0};     ///< bytes
    std::atomic<bool> told_{false};        ///< that text is lost
    std::atomic<bool> counted_{false};     ///< how much was lost has been told
};

}  // namespace qvm
