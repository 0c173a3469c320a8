// A file that a command makes of a recording.
#pragma once

#include <string>
#include <string_view>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace krutil_client {

/// A file that was not there before, for its user alone (mode 0600): what is made of a recording tells what its session
/// said, and must not take the place of the recording. What is not whole must not be taken for it: a file that is not
/// kept goes with the object. Not synchronised.
class NewFile {
  public:
    /// Creates it. Throws Failure (Usage), also when there is a file of this name.
    explicit NewFile(std::string name);

    /// Removes the file, unless it is kept.
    ~NewFile();
    NewFile(const NewFile&) = delete;
    NewFile& operator=(const NewFile&) = delete;

    /// Writes all of `bytes` behind what is there. Throws Failure (Usage).
    void write(std::string_view bytes);

    /// It is whole.
    void keep() noexcept { kept_ = true; }

  private:
    [[noreturn]] void fail(const char* what) const;

    const std::string name_;
    const foundation::core::posix::OwnedDescriptor file_;
    bool kept_ = false;
};

}  // namespace krutil_client
