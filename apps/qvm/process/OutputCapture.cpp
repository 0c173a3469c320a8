#include "qvm/process/OutputCapture.hpp"

#include <fcntl.h>
#include <poll.h>
#include <pthread.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <system_error>
#include <utility>

#include "msg_svc/protobuf/ustring.hpp"
#include "qvm/process/StandardDescriptors.hpp"

#if defined(KRUTIL_SANITIZED)
#include <sanitizer/common_interface_defs.h>
#endif

namespace qvm {
namespace {

// Read at a time, so that one busy writer does not keep the other descriptor waiting.
constexpr std::size_t pieceBytes = 16'384;

std::atomic<OutputCapture*> current{nullptr};

// Bytes of a sequence by its first one; 1 for what begins none.
std::size_t sequenceLength(unsigned char lead) noexcept {
    if (lead < 0xC2 || lead > 0xF4) {
        return 1;
    }
    return lead < 0xE0 ? 2 : lead < 0xF0 ? 3 : 4;
}

// How many bytes at the end may be the beginning of a sequence.
std::size_t incompleteTail(std::string_view bytes) noexcept {
    for (std::size_t tail = 1; tail <= std::min<std::size_t>(3, bytes.size()); ++tail) {
        const auto byte = static_cast<unsigned char>(bytes[bytes.size() - tail]);
        if ((byte & 0xC0U) != 0x80U) {
            return sequenceLength(byte) > tail ? tail : 0;
        }
    }
    return 0;
}

}  // namespace

std::u16string Utf8Assembler::add(std::string_view bytes) {
    held_ += bytes;
    std::string rest = held_.substr(held_.size() - incompleteTail(held_));
    held_.resize(held_.size() - rest.size());
    std::u16string text = msg_svc::protobuf::utf8_to_ustring(held_);
    held_ = std::move(rest);
    return text;
}

std::u16string Utf8Assembler::finish() {
    return msg_svc::protobuf::utf8_to_ustring(std::exchange(held_, {}));
}

OutputCapture::OutputCapture(Emit emit, std::function<void()> waitForRoom)
    : emit_(std::move(emit)), waitForRoom_(std::move(waitForRoom)), stop_("Capturing output") {
    // A handler cannot be taken back, so it is installed once and looks at `current`.
    static const int error = ::pthread_atfork(nullptr, nullptr, [] {
        if (OutputCapture* const capture = current.exchange(nullptr)) {
            capture->closeInChild();
        }
    });
    try {
        if (error != 0) {
            throw std::system_error(error, std::generic_category(), "Cannot watch for forks of running code");
        }
        for (Source& source : sources_) {
            redirect(source);
        }
    } catch (...) {
        std::for_each(sources_.begin(), sources_.end(), [this](Source& source) { restore(source); });
        throw;
    }
#if defined(KRUTIL_SANITIZED)
    // A report is the last thing that a process writes, and nobody would read the pipe any more.
    __sanitizer_set_report_fd(reinterpret_cast<void*>(static_cast<long>(sources_[1].before)));
#endif
    // A pipe takes whole lines only as they end, not after a buffer's worth.
    std::setvbuf(stdout, nullptr, _IOLBF, BUFSIZ);
    current = this;
    thread_ = std::thread([this] { run(); });
}

OutputCapture::~OutputCapture() {
    current = nullptr;
    stop_.raise();
    thread_.join();
    finish();
#if defined(KRUTIL_SANITIZED)
    __sanitizer_set_report_fd(reinterpret_cast<void*>(static_cast<long>(STDERR_FILENO)));
#endif
    std::for_each(sources_.begin(), sources_.end(), [this](Source& source) { restore(source); });
}

void OutputCapture::redirect(Source& source) {
    std::array<int, 2> ends{};
    if (::pipe2(ends.data(), O_CLOEXEC) != 0) {
        throw std::system_error(errno, std::generic_category(), "Capturing output needs a pipe");
    }
    source.before = ::fcntl(source.descriptor, F_DUPFD_CLOEXEC, firstPrivateDescriptor);
    source.pipe = ::fcntl(ends[0], F_DUPFD_CLOEXEC, firstPrivateDescriptor);
    ::close(ends[0]);
    const bool done = source.before >= 0 && source.pipe >= 0 && ::fcntl(source.pipe, F_SETFL, O_NONBLOCK) == 0 &&
                      ::dup2(ends[1], source.descriptor) >= 0;
    const int error = errno;
    ::close(ends[1]);
    if (!done) {
        throw std::system_error(error, std::generic_category(), "Capturing output needs descriptors 1 and 2");
    }
}

void OutputCapture::restore(Source& source) noexcept {
    if (source.before >= 0) {
        ::dup2(source.before, source.descriptor);
        ::close(source.before);
    }
    if (source.pipe >= 0) {
        ::close(source.pipe);
    }
}

bool OutputCapture::readAvailable(Source& source) {
    int available = 0;
    bool emitted = false;
    if (::ioctl(source.pipe, FIONREAD, &available) != 0) {
        return false;
    }
    // No more than was there at first, or a busy writer would keep this going.
    while (available > 0) {
        std::array<char, pieceBytes> bytes;
        const ssize_t count =
            ::read(source.pipe, bytes.data(), std::min(bytes.size(), static_cast<std::size_t>(available)));
        if (count < 0 && errno == EINTR) {
            continue;
        }
        if (count <= 0) {
            break;
        }
        available -= static_cast<int>(count);
        emit_(source.descriptor, source.text.add({bytes.data(), static_cast<std::size_t>(count)}));
        emitted = true;
    }
    return emitted;
}

bool OutputCapture::drain() {
    const std::lock_guard lock(mutex_);
    // Mostly there is nothing, and one call tells.
    std::array<pollfd, 2> watched{{{sources_[0].pipe, POLLIN, 0}, {sources_[1].pipe, POLLIN, 0}}};
    bool emitted = false;
    if (::poll(watched.data(), watched.size(), 0) > 0) {
        for (Source& source : sources_) {
            emitted = readAvailable(source) || emitted;
        }
    }
    return emitted;
}

void OutputCapture::finish() {
    std::fflush(stdout);
    std::fflush(stderr);
    drain();
    const std::lock_guard lock(mutex_);
    for (Source& source : sources_) {
        if (const std::u16string rest = source.text.finish(); !rest.empty()) {
            emit_(source.descriptor, rest);
        }
    }
}

void OutputCapture::run() {
    std::array<pollfd, 3> watched{
        {{stop_.get(), POLLIN, 0}, {sources_[0].pipe, POLLIN, 0}, {sources_[1].pipe, POLLIN, 0}}};
    for (;;) {
        if (::poll(watched.data(), watched.size(), -1) < 0 && errno != EINTR) {
            return;
        }
        if (watched[0].revents != 0) {
            return;
        }
        drain();
        for (pollfd& each : watched) {
            if (each.revents != 0 && (each.revents & POLLIN) == 0) {
                // Running code has closed one of the ends, so nothing will ever come.
                each.fd = -1;
            }
        }
        waitForRoom_();
    }
}

// Calls nothing but close(2): other threads' locks are not to be waited for.
void OutputCapture::closeInChild() noexcept {
    for (Source& source : sources_) {
        ::close(source.pipe);
    }
    stop_.closeInChild();
}

}  // namespace qvm
