// Looks at received contents before the serializers convert them.
#pragma once

#include <memory>

#include "foundation/msg_svc/transport/layers/session/WireWalk.hpp"

namespace apps {

/// For SessionConfig::check: knows the messages of all tags of the protocol. With `numbers` it refuses the stream
/// numbers of texts and the statuses of errors, at any depth, that the protocol's conversions end the process for. Made
/// by the first call with that argument, once for the process; any thread.
std::shared_ptr<const foundation::msg_svc::transport::layers::session::WireWalk> precheck(bool numbers);

}  // namespace apps
