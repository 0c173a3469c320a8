// The descriptors that the engine works with, which running code shares and may close.
#pragma once

#include <poll.h>
#include <sys/types.h>

#include <vector>

namespace qvm {

/// Remembers the descriptors that the engine has opened. Without one of them threads would wait for ever, or spin, so
/// the engine looks now and then.
class OwnDescriptors {
  public:
    /// Remembers what is open now and closed on exec: so not 0 to 2, nor what the program was started with.
    OwnDescriptors();

    /// Whether all are open still. One system call; a number that another file has now counts as open.
    bool areOpen() noexcept;

    /// Whether all are open still and lead to what they led to. A system call for each. Files that have no inode of
    /// their own, such as event and timer descriptors, are not told apart from each other.
    bool areOurs() const noexcept;

  private:
    struct File {
        int descriptor;
        dev_t device;
        ino_t inode;
    };

    std::vector<pollfd> watched_;
    std::vector<File> files_;
};

}  // namespace qvm
