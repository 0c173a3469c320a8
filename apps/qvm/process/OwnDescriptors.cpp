#include "qvm/process/OwnDescriptors.hpp"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <charconv>
#include <filesystem>
#include <string>

namespace qvm {

OwnDescriptors::OwnDescriptors() {
    std::error_code ignored;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd", ignored)) {
        const std::string name = entry.path().filename().string();
        int descriptor = -1;
        std::from_chars(name.data(), name.data() + name.size(), descriptor);
        watched_.push_back({descriptor, 0, 0});
    }
    // Looked at when the directory itself is closed again.
    watched_.erase(std::remove_if(watched_.begin(), watched_.end(),
                                  [](const pollfd& each) {
                                      const int flags = ::fcntl(each.fd, F_GETFD);
                                      return flags < 0 || (flags & FD_CLOEXEC) == 0;
                                  }),
                   watched_.end());
    for (const pollfd& each : watched_) {
        struct stat status {};
        if (::fstat(each.fd, &status) == 0) {
            files_.push_back({each.fd, status.st_dev, status.st_ino});
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
    return std::all_of(files_.begin(), files_.end(), [](const File& each) {
        struct stat status {};
        return ::fstat(each.descriptor, &status) == 0 && status.st_dev == each.device && status.st_ino == each.inode;
    });
}

}  // namespace qvm
