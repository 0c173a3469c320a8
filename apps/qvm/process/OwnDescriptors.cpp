#include "qvm/process/OwnDescriptors.hpp"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <charconv>
#include <filesystem>
#include <optional>
#include <string>

namespace qvm {
namespace {

// What a descriptor leads to; nothing when it is closed. The session may close its descriptors meanwhile. That is no
// race that matters: whoever sees a closed one waits for the end of the session. statx() says so to the thread
// sanitizer, which takes fstat() for a use of the file.
std::optional<OwnDescriptors::File> fileOf(int descriptor) noexcept {
    struct statx status {};
    if (::statx(descriptor, "", AT_EMPTY_PATH, STATX_INO, &status) != 0) {
        return std::nullopt;
    }
    return OwnDescriptors::File{descriptor, {status.stx_dev_major, status.stx_dev_minor}, status.stx_ino};
}

}  // namespace

OwnDescriptors::OwnDescriptors() {
    std::error_code ignored;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd", ignored)) {
        const std::string name = entry.path().filename().string();
        int descriptor = -1;
        std::from_chars(name.data(), name.data() + name.size(), descriptor);
        watched_.push_back({descriptor, 0, 0});
    }
    // Looked at when the directory itself is closed again. The seals come first: what is closed in between is not kept.
    watched_.erase(std::remove_if(watched_.begin(), watched_.end(),
                                  [](const pollfd& each) {
                                      const int seals = ::fcntl(each.fd, F_GET_SEALS);
                                      const int flags = ::fcntl(each.fd, F_GETFD);
                                      const bool isShared = seals >= 0 && (seals & F_SEAL_SHRINK) != 0;
                                      return flags < 0 || (flags & FD_CLOEXEC) == 0 || isShared;
                                  }),
                   watched_.end());
    for (const pollfd& each : watched_) {
        if (const std::optional<File> file = fileOf(each.fd)) {
            files_.push_back(*file);
        }
    }
}

bool OwnDescriptors::areOpen() noexcept {
    // One call for all of them, which asks for no events.
    return ::poll(watched_.data(), watched_.size(), 0) <= 0 ||
           std::none_of(watched_.begin(), watched_.end(),
                        [](const pollfd& each) { return (each.revents & POLLNVAL) != 0; });
}

bool OwnDescriptors::areOurs() const noexcept {
    return std::all_of(files_.begin(), files_.end(), [](const File& each) { return fileOf(each.descriptor) == each; });
}

}  // namespace qvm
