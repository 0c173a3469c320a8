// Writes the fuzzers' seeds, made of the samples, into a folder of DIRECTORY for each.

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iostream>

#include "common/MessageNames.hpp"
#include "input/FuzzInput.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "samples/Samples.hpp"

namespace {

void write(const std::filesystem::path& path, const std::string& bytes) {
    std::ofstream file(path, std::ios::binary | std::ios::trunc);
    file.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
    if (!file.flush()) {
        throw std::runtime_error("cannot write " + path.string());
    }
}

std::string littleEndian(std::uint64_t value, std::size_t bytes) {
    std::string text;
    for (std::size_t i = 0; i < bytes; ++i) {
        text += static_cast<char>(value >> (8 * i) & 0xFF);
    }
    return text;
}

// The bytes of a message as they travel in a session, behind the length of the pieces in which they arrive.
std::string wireBytes(const std::vector<transport::FrameContent>& frames) {
    std::string bytes(1, '\x10');
    for (std::size_t i = 0; i < frames.size(); ++i) {
        const auto& frame = frames[i];
        const bool last = i + 1 == frames.size();
        bytes += static_cast<char>((frame.tagged ? 1 : 2) | (last ? 0x80 : 0));
        bytes += static_cast<char>(frame.type);
        bytes += littleEndian(frame.tag.size(), 2) + littleEndian(frame.streamID, 4) + littleEndian(frame.index, 8) +
                 littleEndian(frame.bytes.size(), 8) + frame.tag + frame.bytes;
    }
    return bytes;
}

std::string header(unsigned kind, std::uint64_t type, std::uint64_t index, std::uint64_t contentSize) {
    return std::string(1, static_cast<char>(kind)) + littleEndian(type, 1) + littleEndian(0, 6) +
           littleEndian(index, 8) + littleEndian(contentSize, 8);
}

// Where a content of 1 MiB lies in shared memory.
std::string sharedContent(std::uint64_t offset) {
    return header(5, 4, 1, 24) + littleEndian(7, 8) + littleEndian(offset, 8) + littleEndian(1U << 20, 8);
}

// What only a session with shared memory sends, behind the length of the pieces and the bit that says so.
std::vector<std::string> sharedMemoryBytes() {
    const std::string root = header(0x81, 29, 2, 0);
    return {'\x90' + sharedContent(0) + root, '\xFF' + sharedContent(4096) + header(6, 0, 7, 0),
            '\x87' + header(6, 0, 7, 0) + header(6, 1, 8, 0), '\x98' + header(6, 2, 7, 0)};
}

// A content behind the place of its type among the names.
std::string walkInput(const transport::FrameContent& frame) {
    const auto names = apps::messageNames();
    const auto found =
        std::find_if(names.begin(), names.end(), [&](const apps::MessageName& name) { return name.tag == frame.tag; });
    return static_cast<char>(found - names.begin()) + frame.bytes;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::cerr << "usage: krutil_fuzz_seeds DIRECTORY\n";
        return 2;
    }
    const std::filesystem::path deserialize = std::filesystem::path(argv[1]) / "deserialize";
    const std::filesystem::path reader = std::filesystem::path(argv[1]) / "message_reader";
    const std::filesystem::path walk = std::filesystem::path(argv[1]) / "wire_walk";
    std::filesystem::create_directories(deserialize);
    std::filesystem::create_directories(reader);
    std::filesystem::create_directories(walk);
    const auto registry = transport::sessionRegistry();
    const auto& serializers = registry->serializers();
    std::size_t count = 0;
    for (const auto& set : samples::sampleSets()) {
        for (const auto& sample : set.samples) {
            const auto frames = transport::writtenFrames(*registry->find(set.serializer), sample.object, registry);
            std::vector<fuzz::FrameInput> inputs;
            for (const auto& frame : frames) {
                std::uint8_t tag = 0xFF;
                for (std::size_t i = 0; i < serializers.size(); ++i) {
                    if (frame.tagged && serializers[i]->name() == frame.tag) {
                        tag = static_cast<std::uint8_t>(i);
                    }
                }
                inputs.push_back({tag, static_cast<std::uint8_t>(frame.type), frame.bytes});
            }
            const std::string name = std::to_string(++count);
            const std::string input = fuzz::formatInput(inputs);
            const std::string wire = wireBytes(frames);
            write(deserialize / name, input);
            write(reader / name, wire);
            // Cut in the middle as well: what is lost on the way looks like this.
            write(deserialize / (name + "-cut"), input.substr(0, input.size() / 2));
            write(reader / (name + "-cut"), wire.substr(0, wire.size() / 2));
            const std::string content = walkInput(frames.back());
            write(walk / name, content);
            write(walk / (name + "-cut"), content.substr(0, content.size() / 2));
        }
    }
    for (const std::string& wire : sharedMemoryBytes()) {
        const std::string name = std::to_string(++count);
        write(reader / name, wire);
        write(reader / (name + "-cut"), wire.substr(0, wire.size() / 2));
    }
    return 0;
}
