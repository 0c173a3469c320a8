// A file that text is added to: the diary and the engine's log.
#pragma once

#include <string>
#include <string_view>

namespace qvm {

/// Several processes may append to one file; each append is one write. May be used from any thread.
class AppendFile {
  public:
    /// Opens or creates the file (mode 0600). An empty path makes an object that drops what it is given. Throws
    /// std::system_error when the file cannot be opened.
    explicit AppendFile(const std::string& path);
    ~AppendFile();
    AppendFile(const AppendFile&) = delete;
    AppendFile& operator=(const AppendFile&) = delete;

    explicit operator bool() const noexcept { return descriptor_ >= 0; }

    /// Adds `text`. A full disk loses it: output must not stop for the copy's sake.
    void append(std::string_view text) noexcept;

  private:
    int descriptor_ = -1;
};

/// Writes all of `text` to a descriptor; gives up at the first error other than an interruption.
void writeFully(int descriptor, std::string_view text) noexcept;

}  // namespace qvm
