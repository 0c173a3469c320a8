// On whose behalf a request runs inside one process.
#pragma once

namespace krutil::cmddistributor {

/// Process-local; never travels. Messages rebuilt from a stream carry none.
class Impersonable {
  public:
    virtual ~Impersonable();
};

}  // namespace krutil::cmddistributor
