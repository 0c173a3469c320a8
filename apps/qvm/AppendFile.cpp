#include "qvm/AppendFile.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>

namespace qvm {

AppendFile::AppendFile(const std::string& path) {
    if (path.empty()) {
        return;
    }
    descriptor_ = ::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0600);
    if (descriptor_ < 0) {
        throw std::system_error(errno, std::generic_category(), "Cannot append to \"" + path + "\"");
    }
}

AppendFile::~AppendFile() {
    if (descriptor_ >= 0) {
        ::close(descriptor_);
    }
}

void AppendFile::append(std::string_view text) noexcept {
    if (descriptor_ >= 0) {
        writeFully(descriptor_, text);
    }
}

void writeFully(int descriptor, std::string_view text) noexcept {
    while (!text.empty()) {
        const ssize_t written = ::write(descriptor, text.data(), text.size());
        if (written >= 0) {
            text.remove_prefix(static_cast<std::size_t>(written));
        } else if (errno != EINTR) {
            return;
        }
    }
}

}  // namespace qvm
