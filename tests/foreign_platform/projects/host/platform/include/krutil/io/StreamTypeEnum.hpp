// Kinds of text.
#pragma once

namespace krutil::io {

enum StreamTypeEnum : int { printed, complained, other };

}  // namespace krutil::io
