// The workspace that a request may bring along inside one process.
#pragma once

namespace foundation::korveldata {

/// Process-local; never travels. Requests rebuilt from a stream carry none.
class ICustomWorkspace {
  public:
    virtual ~ICustomWorkspace();
};

}  // namespace foundation::korveldata
