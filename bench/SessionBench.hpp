// What a session costs beside the same bytes over the same kind of stream without one.
#pragma once

namespace bench {

/// Registers, each over a socket pair between two threads of this process,
///
///     session/round trip   a request and its reply    beside  as many bytes there and back, each in one write
///     session/text         1,000 text events          beside  as many writes of as many bytes, read in large pieces
///     session/array        a call with an array       beside  its bytes, read into memory of that size
///
/// with wall-clock times.
void addSessionBenches();

}  // namespace bench
