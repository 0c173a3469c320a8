#include "qvm/process/Log.hpp"

#include <unistd.h>

#include <array>
#include <ctime>

#include "foundation/core/posix/writeFully.hpp"
#include "qvm/process/StandardDescriptors.hpp"

namespace qvm {
namespace {

std::string stamped(std::string_view text) {
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    tm parts{};
    ::gmtime_r(&now.tv_sec, &parts);
    std::array<char, 40> time{};
    const std::size_t length = std::strftime(time.data(), time.size(), "%Y-%m-%dT%H:%M:%SZ ", &parts);
    std::string line(time.data(), length);
    line += std::to_string(::getpid()) + " ";
    line += text;
    if (line.back() != '\n') {
        line += '\n';
    }
    return line;
}

}  // namespace

Log::Log(const std::string& path)
    : stderr_(duplicateAside(STDERR_FILENO, "Cannot keep standard error")),
      file_(path, [this](const std::string& sentence) { tell(sentence); }) {}

void Log::say(std::string_view text) noexcept {
    tell(text);
    note(text);
}

void Log::note(std::string_view text) noexcept {
    if (!file_) {
        return;
    }
    try {
        file_.append(stamped(text));
    } catch (const std::bad_alloc&) {
        // Nothing can be said without memory.
    }
}

// To standard error only.
void Log::tell(std::string_view text) const noexcept {
    try {
        posix::writeFully(stderr_.get(), "krutil-qvm: " + std::string(text) + "\n");
    } catch (const std::bad_alloc&) {
        // As above.
    }
}

}  // namespace qvm
