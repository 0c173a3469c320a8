// The vectors as files: a manifest in JSON, and for each vector a file with its bytes.
#pragma once

#include <filesystem>
#include <map>
#include <string>

namespace conformance {

/// The directory of these files, in the source tree.
std::filesystem::path directory();

/// What each file should hold, by its path below directory().
std::map<std::filesystem::path, std::string> renderedFiles();

/// What is there: every file of the manifest's directory that renderedFiles() could name.
std::map<std::filesystem::path, std::string> filesOnDisk();

}  // namespace conformance
