// What C libraries and child processes write to descriptors 1 and 2.
//
// Both descriptors become pipes, whose other ends are read here: by a thread of this object, and by drain() when order
// matters. So a child process may write as long as it likes, and what was written before Python's own text or before
// the end of a request comes before it.
#pragma once

#include <array>
#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>

#include "foundation/core/posix/EventDescriptor.hpp"

namespace qvm {

namespace posix = foundation::core::posix;

/// Makes valid UTF-8 of bytes that arrive in pieces: a sequence that two pieces share is kept together, and each
/// maximal ill-formed piece becomes U+FFFD. A value.
class Utf8Assembler {
  public:
    /// Text of what is held and of `bytes`; the beginning of a sequence at its end is held back.
    std::u16string add(std::string_view bytes);

    /// Text of what is held back.
    std::u16string finish();

  private:
    std::string held_;
};

/// See the head of this file. One object at a time in a process. Descriptors that are read here are closed in forked
/// children, whose writes keep going into the pipes.
class OutputCapture {
  public:
    /// Takes text of descriptor 1 or 2; called with one thread at a time, in order. Must not wait and must not throw.
    using Emit = std::function<void(int descriptor, const std::u16string& text)>;

    /// Redirects descriptors 1 and 2 and starts the thread, which calls `waitForRoom` after each piece so that a client
    /// that does not read holds the writers up. Throws std::system_error.
    OutputCapture(Emit emit, std::function<void()> waitForRoom);

    /// Gives the descriptors back what they were, and emits what is left.
    ~OutputCapture();
    OutputCapture(const OutputCapture&) = delete;
    OutputCapture& operator=(const OutputCapture&) = delete;

    /// Emits what was written before the call, and what is there of other processes' writes; a beginning of a sequence
    /// stays held back. Waits for no process and for no client; returns whether anything was emitted. May be called
    /// from any thread.
    bool drain();

    /// The same, after flushing the C library's streams and with an incomplete sequence as U+FFFD.
    void finish();

  private:
    struct Source {
        int descriptor;  // 1 or 2
        int pipe = -1;   // its reading end
        int before = -1;
        Utf8Assembler text{};
    };

    void redirect(Source& source);
    void restore(Source& source) noexcept;
    bool readAvailable(Source& source);
    void run();
    void closeInChild() noexcept;

    const Emit emit_;
    const std::function<void()> waitForRoom_;
    std::mutex mutex_;
    std::array<Source, 2> sources_{Source{1}, Source{2}};
    posix::EventDescriptor stop_;
    std::thread thread_;
};

}  // namespace qvm
