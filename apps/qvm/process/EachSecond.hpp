// What is done each second.
#pragma once

#include <functional>
#include <memory>

namespace qvm {

/// Calls a function each second, on a thread of its own. It needs no descriptor and no signal, since running code can
/// take both away.
class EachSecond {
  public:
    /// Throws std::system_error when the system has no thread left.
    explicit EachSecond(std::function<void()> call);

    /// When this returns, the function does not run and will not be called any more. The thread ends a second
    /// later, or with the process.
    ~EachSecond();
    EachSecond(const EachSecond&) = delete;
    EachSecond& operator=(const EachSecond&) = delete;

  private:
    struct Shared;
    std::shared_ptr<Shared> shared_;
};

}  // namespace qvm
