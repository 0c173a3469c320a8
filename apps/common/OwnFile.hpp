// Files that keep what a session says.
#pragma once

#include <sys/stat.h>

#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace apps {

/// A file that nobody else has put in its place.
struct OwnFile {
    foundation::core::posix::OwnedDescriptor descriptor;  ///< writes at the end
    bool regular = false;                                 ///< and no device or pipe
};

/// What is done with a file that is there.
enum class Begin {
    Empty,  ///< it is emptied, and nobody else may read it any more
    AtEnd,  ///< it is gone on with, and whoever may read it still may
};

/// Why a file that is there must not keep what a session says: it belongs to another user, or has several names, and so
/// another user may have put it there. Empty when it may. Devices are anybody's, and links of the administrator are
/// too.
std::string objectionTo(const struct stat& status);

/// Opens the file, or creates it for this user alone. What is there already, a symbolic link too, must raise
/// no objection. So no other user can say where text goes. Throws std::runtime_error: `cannot`, and why.
OwnFile openOwnFile(const std::string& path, Begin begin, const std::string& cannot);

}  // namespace apps
