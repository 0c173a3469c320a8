// The descriptors that the engine works with, which running code shares and may close.
#pragma once

#include <poll.h>

#include <vector>

namespace qvm {

/// Remembers the descriptors that the engine has opened. Without one of them threads would wait for ever, or spin, so
/// the engine looks now and then. A descriptor whose number was given to another file meanwhile is not noticed.
class OwnDescriptors {
  public:
    /// Remembers what is open now and closed on exec: so not 0 to 2, nor what the program was started with.
    OwnDescriptors();

    /// Whether all are open still.
    bool areOpen() noexcept;

  private:
    std::vector<pollfd> watched_;
};

}  // namespace qvm
