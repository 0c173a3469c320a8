// The descriptors that the engine works with, which running code shares and may close.
#pragma once

#include <poll.h>

#include <cstdint>
#include <utility>
#include <vector>

namespace qvm {

/// Remembers the descriptors that the engine has opened. Without one of them threads would wait for ever, or spin, so
/// the engine looks now and then.
class OwnDescriptors {
  public:
    /// Remembers what is open now and closed on exec: so not 0 to 2, nor what the program was started with. Sealed
    /// memory is left out: it is the peer's, of an array that has just come, and is closed as soon as it is mapped.
    OwnDescriptors();

    /// Whether all are open still. One system call; a number that another file has now counts as open.
    bool areOpen() noexcept;

    /// Whether all are open still and lead to what they led to. A system call for each. Files that have no inode of
    /// their own, such as event and timer descriptors, are not told apart from each other.
    bool areOurs() const noexcept;

    /// What a descriptor leads to: major and minor number of the device, and the inode there.
    struct File {
        int descriptor;
        std::pair<std::uint32_t, std::uint32_t> device;
        std::uint64_t inode;

        bool operator==(const File&) const = default;
    };

  private:
    std::vector<pollfd> watched_;
    std::vector<File> files_;
};

}  // namespace qvm
