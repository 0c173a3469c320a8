// A whole session between two ends in this process, as bytes.
#pragma once

#include <filesystem>
#include <string>

namespace fuzz {

struct RecordedSession {
    std::string toClient;  ///< all bytes that the client has read
    std::string toEngine;
    std::string file;  ///< the client's recording
};

/// Requests, events and replies of the samples, and an orderly end. Writes a recording into `folder`, and removes it.
RecordedSession recordSession(const std::filesystem::path& folder);

}  // namespace fuzz
