// Text on its way from running code to the client.
//
// Whatever running code writes passes through here: it is assigned to the request that runs, or to none, held back
// until a newline, an amount or a time, and handed on in the order of writing. Lines that follow each other closely are
// handed on together; the first one after a silence does not wait. The running requests are a stack, because a prompt
// of one request evaluates others.
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"
#include "krutil/io/SinkTraits.hpp"
#include "krutil/io/StreamTypeEnum.hpp"
#include "qvm/process/FlushTimer.hpp"
#include "qvm/requests/Request.hpp"

namespace qvm {

/// Which door a piece of text came through.
enum class TextSource {
    Output,       ///< sys.stdout
    Error,        ///< sys.stderr
    ShownOutput,  ///< shown by the engine on the output sink: a value, the echo
    ShownError,   ///< the same on the error sink
    PlainOutput,  ///< descriptor 1: text of no request, whoever wrote it
    PlainError,   ///< the same of descriptor 2
};

/// What a piece of text is and where it goes.
struct TextTarget {
    framing::StreamID stream = 0;              ///< exchange that it travels on; 0 for text of no request
    foundation::msg_svc::exchange::IDType id;  ///< the request; default for none
    krutil::io::StreamTypeEnum type = krutil::io::StreamTypeEnum::GENERIC_STREAM;
    bool shown = false;  ///< shown by the engine rather than written by the code
    bool diary = false;  ///< the sink's text goes to the diary too
    bool log = false;    ///< the sink's text goes to the log too

    bool operator==(const TextTarget&) const = default;
};

/// See the head of this file. All members may be called from any thread. No member needs the interpreter lock, and none
/// waits for the client: after a write that handed text on, the caller waits until the session has room.
class TextOutput {
  public:
    /// Takes well-formed UTF-16 text of at most Settings::maxUnits. Called with one thread at a time, in order; must
    /// not throw and must not call back.
    using Emit = std::function<void(const TextTarget& target, std::u16string text)>;

    struct Settings {
        std::size_t flushUnits = 8192;  ///< held text of this many UTF-16 units is handed on
        std::size_t maxUnits = 32768;   ///< longest piece that is handed on, in UTF-16 units; at least 2
        std::chrono::milliseconds delay{20};
        std::chrono::milliseconds sparingDelay{200};  ///< for requests that may be flushed sparingly
        std::chrono::milliseconds lineGap{1};         ///< lines that follow each other faster are handed on together
    };

    /// Has flushDue() called at a time, or before; see FlushTimer::expect().
    using Expect = std::function<void(FlushTimer::Time due)>;

    /// The calling thread becomes the one whose text belongs to running requests.
    TextOutput(Settings settings, Emit emit, Expect expect);

    /// Hands on what is held back.
    ~TextOutput();
    TextOutput(const TextOutput&) = delete;
    TextOutput& operator=(const TextOutput&) = delete;

    /// From now on text belongs to `request`.
    void begin(const Request& request);

    /// Hands on what is held back. From now on text belongs to the request that ran before, or to none.
    void end();

    /// Hands on what is held back. The request that runs writes nothing until end(): a prompt holds it up, and text
    /// that comes meanwhile belongs to none.
    void suspend();

    /// Takes well-formed UTF-16 text. Returns whether any text was handed on, by this call or by flushDue() since the
    /// last call.
    bool write(TextSource source, std::u16string_view text);

    /// Hands on what is held back; returns whether that was anything.
    bool flush();

    /// Hands on what is due at `now`; returns when the rest is, FlushTimer::never if there is none.
    FlushTimer::Time flushDue(FlushTimer::Time now);

    /// Traits of the running request's output sink; all false when none runs.
    krutil::io::SinkTraits outputTraits() const;

  private:
    using Clock = FlushTimer::Clock;

    std::optional<TextTarget> route(TextSource source) const;
    bool handOn();

    const Settings settings_;
    const Emit emit_;
    const Expect expect_;
    const std::thread::id requestThread_;

    mutable std::mutex mutex_;
    std::vector<Request> running_;  // one without a message stands for a prompt
    TextTarget target_;
    std::u16string held_;
    Clock::time_point due_;       // of the held text, when there is any
    Clock::time_point nextLine_;  // lines are handed on without waiting for others from then on
    bool handedOnLate_ = false;   // by flushDue(), and no write() has told so yet
};

}  // namespace qvm
