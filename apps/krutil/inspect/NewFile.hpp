// A file that a command makes of a recording.
#pragma once

#include <string>
#include <string_view>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace krutil_client {

/// A file that was not there before, for its user alone (mode 0600): what is made of a recording tells what its session
/// said, and must not take the place of the recording. Not synchronised.
class NewFile {
  public:
    /// Creates it. Throws Failure (Usage), also when there is a file of this name.
    explicit NewFile(std::string name);

    /// Writes all of `bytes` behind what is there. Throws Failure (Usage).
    void write(std::string_view bytes);

  private:
    [[noreturn]] void fail(const char* what) const;

    const std::string name_;
    const foundation::core::posix::OwnedDescriptor file_;
};

}  // namespace krutil_client
