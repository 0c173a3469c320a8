// A file that is nowhere but in memory, for what reads by a name.
#pragma once

#include <sys/mman.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "input/Require.hpp"

namespace fuzz {

/// Holds the bytes of an input as long as it lives.
class MemoryFile {
  public:
    MemoryFile(const std::uint8_t* data, std::size_t size) : file_(::memfd_create("fuzz", MFD_CLOEXEC)) {
        require(::write(file_.get(), data, size) == static_cast<ssize_t>(size), "there is memory for a file");
        require(::lseek(file_.get(), 0, SEEK_SET) == 0, "a file can be read from its beginning");
    }

    /// A path by which this process can open it.
    std::string path() const { return "/proc/self/fd/" + std::to_string(file_.get()); }

  private:
    const foundation::core::posix::OwnedDescriptor file_;
};

}  // namespace fuzz
