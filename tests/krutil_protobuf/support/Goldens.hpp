// Golden files: for each sample the exact bytes of its frames, with a reading of them that a person can check. One file
// holds the samples of one serializer.
//
//     sample typical
//     frame 1 tagged type 29 stream 7 size 38 tag krutil:TextBaseEvent
//       0000 | 0a 14 08 ef ...                           the bytes, 32 on a line, by offset
//       0000 id #1 length-delimited 20 bytes             the fields: offset, path, number, wire type, value
//       0002   id.hi #1 varint 81985529216486895
//
// Nothing but krutil_regenerate_goldens writes them.
#pragma once

#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace goldens {

/// The directory of the golden files, in the source tree.
std::filesystem::path directory();

/// File of the set with this registered name: the name with dots for its colons.
std::filesystem::path fileOf(const std::string& serializer);

/// What the file of `set` should hold. Throws what the serializers throw.
std::string render(const samples::SampleSet& set, const std::shared_ptr<const transport::Registry>& registry);

/// The frames in a golden file, by sample name; the reading of the bytes is skipped. Throws std::runtime_error for a
/// text that is no golden file.
std::map<std::string, std::vector<transport::FrameContent>> parse(const std::string& text);

}  // namespace goldens
