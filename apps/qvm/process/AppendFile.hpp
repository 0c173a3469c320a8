// A file that text is added to: the diary and the engine's log.
#pragma once

#include <string>
#include <string_view>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace qvm {

namespace posix = foundation::core::posix;

/// Several processes may append to one file; each append is one write. May be used from any thread.
class AppendFile {
  public:
    /// Opens or creates the file (mode 0600). An empty path makes an object that drops what it is given. Throws
    /// std::system_error when the file cannot be opened.
    explicit AppendFile(const std::string& path);

    explicit operator bool() const noexcept { return static_cast<bool>(descriptor_); }

    /// Adds `text`. A full disk loses it: output must not stop for the copy's sake.
    void append(std::string_view text) noexcept;

  private:
    posix::OwnedDescriptor descriptor_;
};

}  // namespace qvm
