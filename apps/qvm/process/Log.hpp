// What the engine says about itself. Results never come here.
#pragma once

#include <string>
#include <string_view>

#include "qvm/process/AppendFile.hpp"

namespace qvm {

/// Writes lines with the time and the process's number to the log file, and what a person should see to the standard
/// error that the program was started with as well. May be used from any thread, and by several processes at once.
class Log {
  public:
    /// `path` is empty for no file. Throws std::runtime_error as AppendFile does, and std::system_error when there is
    /// no descriptor for the duplicate of standard error.
    explicit Log(const std::string& path);

    /// To standard error and the file.
    void say(std::string_view text) noexcept;

    /// To the file only.
    void note(std::string_view text) noexcept;

    /// What the file lacks is told on standard error; see AppendFile.
    bool finish() noexcept { return file_.finish(); }
    void startOver() noexcept { file_.startOver(); }

  private:
    void tell(std::string_view text) const noexcept;

    // A private duplicate: user code may close or redirect descriptor 2.
    posix::OwnedDescriptor stderr_;
    AppendFile file_;
};

}  // namespace qvm
