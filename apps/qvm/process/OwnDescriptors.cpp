#include "qvm/process/OwnDescriptors.hpp"

#include <fcntl.h>

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
}

bool OwnDescriptors::areOpen() noexcept {
    // One call for all of them, which asks for no events.
    return ::poll(watched_.data(), watched_.size(), 0) <= 0 ||
           std::none_of(watched_.begin(), watched_.end(),
                        [](const pollfd& each) { return (each.revents & POLLNVAL) != 0; });
}

}  // namespace qvm
