// Looks at received numbers that would end the process before the serializers convert them.
#pragma once

#include "foundation/vantor/carrier/framing/TaggedFrame.hpp"

namespace apps {

/// For SessionConfig::check. Throws ProtocolViolation, which closes the session, for a stream number of a text event or
/// a status of an error, at any depth, that the protocol's conversions end the process for. Parses the content with the
/// serializers' own parser and limits, so that truncated or malformed content is judged as they will read it; frames of
/// other types cost one look-up of their tag. May be called from any thread.
void precheck(const foundation::vantor::carrier::framing::TaggedFrame& frame);

}  // namespace apps
