#include "foundation/korveldata/ICustomWorkspace.hpp"

namespace foundation::korveldata {

ICustomWorkspace::~ICustomWorkspace() = default;

}  // namespace foundation::korveldata
