#include "qvm/process/AppendFile.hpp"

#include <fcntl.h>

#include <cerrno>
#include <system_error>

#include "foundation/core/posix/writeFully.hpp"

namespace qvm {

AppendFile::AppendFile(const std::string& path) {
    if (path.empty()) {
        return;
    }
    descriptor_.reset(::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0600));
    if (!descriptor_) {
        throw std::system_error(errno, std::generic_category(), "Cannot append to \"" + path + "\"");
    }
}

void AppendFile::append(std::string_view text) noexcept {
    if (descriptor_) {
        posix::writeFully(descriptor_.get(), text);
    }
}

}  // namespace qvm
