// .npy files: arrays as NumPy stores them.
#pragma once

#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/korveldata/Array.hpp"

namespace krutil_client {

namespace posix = foundation::core::posix;

/// The array of a .npy file (format 1.0, 2.0 or 3.0). Its elements are the file's own: the file is mapped read-only,
/// and stays mapped as long as the array, or a frame that borrows it, lives. Two kinds of files are copied instead,
/// once: those in big-endian byte order, and texts, which NumPy stores in 32 bits a character. Elements may be bool,
/// signed and unsigned integers, float32 and float64, complex64 and complex128; a text is a file of shape () whose
/// elements are str. What follows the elements in the file is ignored, as NumPy does.
///
/// The size of the file counts as it is when it is opened. A file that another program shortens while it is mapped
/// raises SIGBUS here when the missing pages are read; a new file that is renamed over it does no harm.
///
/// Throws Failure (Usage) for whatever is no such file.
foundation::korveldata::Array readNpy(const std::string& path);

/// Whether readNpy() of a file that writeTo() wrote would give the array back: false for complex integers and for text
/// of several rows, which NumPy has no type for. `why` then says so.
bool npyCanHold(const foundation::korveldata::Array& array, std::string& why);

/// A .npy file in the making. The elements go to a temporary file in the same directory, which takes the name only when
/// it is complete; so nobody sees half a file, and an array that is mapped from a file of that name stays what it was.
/// A path that is no regular file, such as a device, is written to as it is.
class NpyOutput {
  public:
    /// Creates the temporary file, so that a path that cannot be written is known before there is anything to write.
    /// Throws Failure (Usage).
    explicit NpyOutput(const std::string& path);

    /// Removes the temporary file if the array was not written.
    ~NpyOutput();

    NpyOutput(NpyOutput&& other) noexcept;
    NpyOutput& operator=(NpyOutput&&) = delete;

    /// Writes `array` in its own memory order and gives the file its name; once. Throws Failure (Usage).
    void write(const foundation::korveldata::Array& array);

    /// As the constructor was given it.
    const std::string& path() const noexcept { return path_; }

  private:
    std::string path_;
    std::string target_;     ///< what path_ leads to
    std::string temporary_;  ///< empty when there is none
    posix::OwnedDescriptor file_;
};

}  // namespace krutil_client
