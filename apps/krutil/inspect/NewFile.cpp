#include "krutil/inspect/NewFile.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <system_error>
#include <utility>

#include "foundation/core/posix/writeFully.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {

namespace posix = foundation::core::posix;

NewFile::NewFile(std::string name)
    : name_(std::move(name)),
      file_(::open(name_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOCTTY | O_CLOEXEC, S_IRUSR | S_IWUSR)) {
    if (!file_) {
        fail("create");
    }
}

NewFile::~NewFile() {
    if (!kept_) {
        ::unlink(name_.c_str());
    }
}

void NewFile::write(std::string_view bytes) {
    if (!posix::writeFully(file_.get(), bytes)) {
        fail("write to");
    }
}

void NewFile::fail(const char* what) const {
    throw Failure(ExitCode::Usage,
                  std::string("cannot ") + what + " '" + name_ + "': " + std::generic_category().message(errno));
}

}  // namespace krutil_client
