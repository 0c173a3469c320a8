// Numbers of runtimes and engines.
#pragma once

namespace krutil::contextmgr {

/// A number that is not mixed up with others.
template <class Number, class Of>
class Id {
  public:
    Id(Number number) : number_(number) {}
    operator Number() const { return number_; }

  private:
    Number number_;
};

using QcrID = Id<int, struct Runtime>;
using QvmID = Id<unsigned long, struct Engine>;

}  // namespace krutil::contextmgr
