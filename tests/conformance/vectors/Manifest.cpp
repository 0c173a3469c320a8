#include "conformance/vectors/Manifest.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/util/json_util.h>
#include <google/protobuf/util/type_resolver.h>
#include <google/protobuf/util/type_resolver_util.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <nlohmann/json.hpp>
#include <sstream>
#include <stdexcept>

#include "conformance/vectors/Layout.hpp"
#include "conformance/vectors/Vectors.hpp"
#include "krutil_protobuf/support/Goldens.hpp"
#include "samples/Samples.hpp"

namespace conformance {
namespace {

using nlohmann::ordered_json;

constexpr const char* manifestFile = "manifest.json";
constexpr const char* bytesDirectory = "vectors";

std::filesystem::path bytesFile(const Vector& vector) {
    return std::filesystem::path(bytesDirectory) / goldens::fileOf(vector.type).stem() / (vector.name + ".bin");
}

// The fields in the JSON mapping of Protocol Buffers, under the names that the schema has for them.
ordered_json fieldsOf(const FrameContent& frame, const std::string& name) {
    static const std::string prefix = "type.googleapis.com";
    static const std::unique_ptr<google::protobuf::util::TypeResolver> types(
        google::protobuf::util::NewTypeResolverForDescriptorPool(prefix,
                                                                 google::protobuf::DescriptorPool::generated_pool()));
    google::protobuf::util::JsonPrintOptions options;
    options.preserve_proto_field_names = true;
    std::string text;
    const auto done =
        google::protobuf::util::BinaryToJsonString(types.get(), prefix + "/" + name, frame.bytes, &text, options);
    if (!done.ok()) {
        throw std::runtime_error("no JSON of a " + name + ": " + done.ToString());
    }
    return ordered_json::parse(text);
}

ordered_json linesOf(const std::string& text) {
    ordered_json lines = ordered_json::array();
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) {
        lines.push_back(line);
    }
    return lines;
}

ordered_json frameEntry(const Vector& vector, const FrameContent& frame, std::size_t offset) {
    ordered_json entry{{"index", frame.index},
                       {"kind", frame.tagged ? "tagged" : "data"},
                       {"frame_type", static_cast<int>(frame.type)},
                       {"stream", frame.streamID},
                       {"offset", offset},
                       {"size", frame.bytes.size()}};
    if (!frame.tagged) {
        return entry;
    }
    entry["tag"] = frame.tag;
    // A tag of nobody's stands for no message.
    const auto& sets = samples::sampleSets();
    const auto set =
        std::find_if(sets.begin(), sets.end(), [&](const auto& each) { return each.serializer == frame.tag; });
    if (set == sets.end()) {
        return entry;
    }
    const bool last = &frame == &vector.frames.back();
    const bool parses = !last || vector.parses;
    entry["message"] = set->message;
    entry["parses"] = parses;
    if (last && !vector.differing.empty()) {
        entry["parses_differently_for"] = vector.differing;
    }
    if (parses && (!last || vector.fieldsListed)) {
        entry["fields"] = fieldsOf(frame, set->message);
    }
    return entry;
}

ordered_json vectorEntry(const Vector& vector) {
    ordered_json entry{{"type", vector.type},
                       {"name", vector.name},
                       {"bytes", bytesFile(vector).string()},
                       {"well_formed", vector.wellFormed},
                       {"outcome", vector.accepted ? "accepted" : "refused"}};
    if (vector.accepted) {
        entry["reads_as"] = linesOf(vector.reading);
    } else {
        entry["text"] = vector.refusal;
    }
    if (!vector.note.empty()) {
        entry["note"] = vector.note;
    }
    std::size_t offset = 0;
    for (const FrameContent& frame : vector.frames) {
        offset += headerSize + frame.tag.size();
        entry["frames"].push_back(frameEntry(vector, frame, offset));
        offset += frame.bytes.size();
    }
    return entry;
}

std::string contentOf(const std::filesystem::path& file) {
    std::ifstream in(file, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

}  // namespace

std::filesystem::path directory() {
    return KRUTIL_CONFORMANCE_DIR;
}

std::map<std::filesystem::path, std::string> renderedFiles() {
    std::map<std::filesystem::path, std::string> files;
    ordered_json manifest{{"protocol", "krutil"}, {"version", {1, 0}}};
    for (const Vector& vector : vectors()) {
        manifest["vectors"].push_back(vectorEntry(vector));
        if (!files.emplace(bytesFile(vector), bytesOf(vector.frames)).second) {
            throw std::logic_error("two vectors are named " + vector.type + " " + vector.name);
        }
    }
    files[manifestFile] = manifest.dump(1) + "\n";
    return files;
}

std::map<std::filesystem::path, std::string> filesOnDisk() {
    std::map<std::filesystem::path, std::string> files;
    if (std::filesystem::exists(directory() / manifestFile)) {
        files[manifestFile] = contentOf(directory() / manifestFile);
    }
    if (std::filesystem::exists(directory() / bytesDirectory)) {
        for (const auto& entry : std::filesystem::recursive_directory_iterator(directory() / bytesDirectory)) {
            if (entry.is_regular_file()) {
                files[entry.path().lexically_relative(directory())] = contentOf(entry.path());
            }
        }
    }
    return files;
}

}  // namespace conformance
