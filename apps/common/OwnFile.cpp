#include "common/OwnFile.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <stdexcept>
#include <system_error>

namespace apps {

std::string objectionTo(const struct stat& status) {
    const bool link = S_ISLNK(status.st_mode);
    if (status.st_uid != ::geteuid() && !S_ISCHR(status.st_mode) && !(link && status.st_uid == 0)) {
        return std::string(link ? "it is a symbolic link that belongs" : "it belongs") + " to user " +
               std::to_string(status.st_uid);
    }
    if (S_ISREG(status.st_mode) && status.st_nlink > 1) {
        return "the file has " + std::to_string(status.st_nlink) + " names";
    }
    return {};
}

OwnFile openOwnFile(const std::string& path, Begin begin, const std::string& cannot) {
    const auto fail = [&cannot](const std::string& why) { throw std::runtime_error(cannot + ": " + why); };
    const auto check = [&fail](const struct stat& status) {
        if (const std::string objection = objectionTo(status); !objection.empty()) {
            fail(objection + "; name a file of your own");
        }
    };
    // Before it is opened, because a pipe would wait for its reader.
    struct stat named {};
    const bool there = ::lstat(path.c_str(), &named) == 0;
    if (there) {
        check(named);
    }
    const int follow = there && S_ISLNK(named.st_mode) ? 0 : O_NOFOLLOW;
    OwnFile file{foundation::core::posix::OwnedDescriptor(::open(
                     path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_NOCTTY | O_CLOEXEC | follow, S_IRUSR | S_IWUSR)),
                 false};
    // Again, because it may be another one by now, or what the link leads to.
    struct stat status {};
    if (!file.descriptor || ::fstat(file.descriptor.get(), &status) != 0) {
        fail(std::generic_category().message(errno));
    }
    check(status);
    file.regular = S_ISREG(status.st_mode);
    if (begin == Begin::Empty && file.regular &&
        (::ftruncate(file.descriptor.get(), 0) != 0 || ::fchmod(file.descriptor.get(), S_IRUSR | S_IWUSR) != 0)) {
        fail(std::generic_category().message(errno));
    }
    return file;
}

}  // namespace apps
