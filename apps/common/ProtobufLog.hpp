// What Protocol Buffers has to say, bounded.
#pragma once

namespace apps {

/// Sends the log lines of Protocol Buffers to standard error, at most 10 a minute and a count of those left out: a peer
/// that sends bad text in every message must not fill this end's terminal or log. Fatal lines always appear. The
/// handler belongs to the whole process, so programs install it and libraries do not.
void installProtobufLog();

}  // namespace apps
