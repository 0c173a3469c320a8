// Small messages in the formats that people use instead.
#pragma once

namespace bench {

#ifdef KRUTIL_BENCH_PEERS

/// Registers "small-messages/serialize NAME" and "small-messages/deserialize NAME" for two of codecSamples() and each
/// format, beside the samples' bare code. Throws std::logic_error for a format that does not give back what it was
/// given.
void addSmallMessageBenches();

#else

inline void addSmallMessageBenches() {}

#endif

}  // namespace bench
