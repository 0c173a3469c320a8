// Descriptors 0, 1 and 2 belong to running code; the protocol keeps away from them.
#pragma once

namespace qvm {

/// Private descriptors have numbers from here on. Programs that run code dup onto low numbers.
inline constexpr int firstPrivateDescriptor = 100;

/// As many descriptors an engine must be allowed to have: those with private numbers, and some for the code that it
/// runs.
inline constexpr int neededDescriptors = 128;

/// Throws std::runtime_error when the limit of this process is lower than neededDescriptors. Without this, what needs a
/// private number would fail with words that do not name the limit.
void checkDescriptorLimit();

/// Makes sure that 0, 1 and 2 are open, so that nothing else lands on their numbers. Throws std::system_error.
void holdStandardDescriptors();

/// A close-on-exec duplicate with a private number, which the caller owns. Throws std::system_error that begins with
/// `failure`.
int duplicateAside(int descriptor, const char* failure);

/// The pair of descriptors that a session reads from and writes to.
struct ProtocolDescriptors {
    int in;
    int out;
};

/// Moves the protocol from 0 and 1 to private close-on-exec descriptors, which the caller owns, and gives 0 and 1 to
/// running code. Throws std::system_error.
ProtocolDescriptors moveProtocolAside();

/// Gives descriptor 0 the null device and descriptor 1 a copy of standard error, for running code and its children.
/// Throws std::system_error.
void giveToRunningCode();

}  // namespace qvm
