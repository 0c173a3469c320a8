// Writes the fuzzers' seeds into a folder of DIRECTORY for each target. They are made of the samples where the target
// reads messages.

#include <algorithm>
#include <array>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "common/MessageNames.hpp"
#include "input/FuzzInput.hpp"
#include "krutil_protobuf/support/TestTransport.hpp"
#include "platform/session/support/WireBytes.hpp"
#include "samples/Samples.hpp"
#include "seeds/RecordedSession.hpp"

namespace {

// The folder of one target.
class Seeds {
  public:
    Seeds(const std::filesystem::path& root, const std::string& target) : folder_(root / target) {
        std::filesystem::remove_all(folder_);
        std::filesystem::create_directories(folder_);
    }

    // Cut in the middle as well: what is lost on the way looks like this.
    void add(const std::string& bytes) {
        const std::string name = std::to_string(++count_);
        write(name, bytes);
        write(name + "-cut", bytes.substr(0, bytes.size() / 2));
    }

  private:
    void write(const std::string& name, const std::string& bytes) const {
        std::ofstream file(folder_ / name, std::ios::binary | std::ios::trunc);
        file.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
        if (!file.flush()) {
            throw std::runtime_error("cannot write " + (folder_ / name).string());
        }
    }

    std::filesystem::path folder_;
    std::size_t count_ = 0;
};

// Behind the length of the pieces in which they arrive.
std::string wireBytes(const std::vector<transport::FrameContent>& frames) {
    std::string bytes(1, '\x10');
    for (std::size_t i = 0; i < frames.size(); ++i) {
        const auto& frame = frames[i];
        const bool last = i + 1 == frames.size();
        const auto type = static_cast<unsigned>(frame.type);
        bytes += frame.tagged ? wire::tagged(frame.streamID, frame.index, last, frame.tag, frame.bytes, type)
                              : wire::data(frame.streamID, frame.index, last, frame.bytes, type);
    }
    return bytes;
}

// What only a session with shared memory sends, behind the length of the pieces and the bit that says so.
std::vector<std::string> sharedMemoryBytes() {
    const std::string root = wire::header({1, true, 29, 0, 0, 2, 0});
    return {'\x90' + wire::sharedData(0, 1, 7, 0, 1U << 20) + root,
            '\xFF' + wire::sharedData(0, 1, 7, 4096, 1U << 20) + wire::giveBack(7),
            '\x87' + wire::giveBack(7) + wire::giveBack(8, true), '\x98' + wire::header({6, false, 2, 0, 0, 7, 0})};
}

// A content behind the place of its type among the names.
std::string walkInput(const transport::FrameContent& frame) {
    const auto names = apps::messageNames();
    const auto found =
        std::find_if(names.begin(), names.end(), [&](const apps::MessageName& name) { return name.tag == frame.tag; });
    return static_cast<char>(found - names.begin()) + frame.bytes;
}

std::string messageInput(const std::vector<transport::FrameContent>& frames, const transport::Registry& registry) {
    const auto& serializers = registry.serializers();
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
    return fuzz::formatInput(inputs);
}

void writeMessages(const std::filesystem::path& root) {
    Seeds deserialize(root, "deserialize");
    Seeds roundTrip(root, "round_trip");
    Seeds reader(root, "message_reader");
    Seeds walk(root, "wire_walk");
    Seeds text(root, "text");
    Seeds arrays(root, "arrays");
    const auto registry = transport::sessionRegistry();
    for (const auto& set : samples::sampleSets()) {
        for (const auto& sample : set.samples) {
            const auto frames = transport::writtenFrames(*registry->find(set.serializer), sample.object, registry);
            deserialize.add(messageInput(frames, *registry));
            roundTrip.add(messageInput(frames, *registry));
            reader.add(wireBytes(frames));
            walk.add(walkInput(frames.back()));
            text.add(frames.back().bytes);
            if (frames.back().tag == "krutil:QDA" && frames.size() == 2) {
                arrays.add(std::string{static_cast<char>(frames[0].type), static_cast<char>(frames[1].bytes.size())} +
                           frames[1].bytes + frames[0].bytes);
            }
        }
    }
    for (const std::string& wire : sharedMemoryBytes()) {
        reader.add(wire);
    }
}

void writeSessions(const std::filesystem::path& root) {
    Seeds handshake(root, "handshake");
    Seeds recording(root, "recording");
    const fuzz::RecordedSession session = fuzz::recordSession(root / "recording");
    handshake.add('\0' + session.toClient);
    handshake.add('\1' + session.toEngine);
    recording.add(session.file);

    // Steps of three bytes: a request, an event, a reply, a goodbye, the shutdown event; then some damage.
    Seeds twoEnds(root, "two_ends");
    const std::string_view forward("\5\0\0\5\1\0", 6);
    const std::string begin = std::string("\0\0\1", 3) + std::string(forward);
    const std::string rest = std::string("\1\1\1\2\1\1\3\0\0\4\0\0", 12) + std::string(forward);
    twoEnds.add(begin + rest);
    for (const char damage : {'\6', '\7', '\10', '\11', '\12'}) {
        twoEnds.add(begin + std::string("\1\1\2", 3) + damage + "\x21\x05" + rest);
        twoEnds.add(std::string("\0\0\2", 3) + damage + "\x40\x03" + std::string(forward));
    }
}

void writeArguments(const std::filesystem::path& root) {
    Seeds literals(root, "literals");
    for (const char* literal :
         {"7", "-7", "3.5", "1e3", "-.5", "inf", "nan", "2j", "1+2j", "true", "[false, true]", "\"t\\u00e9xt\\n\"",
          "[1, 2, 3]", "[[1, 2], [3, 4.5]]", "[[], []]", "[]", "[1, 2j]", "18446744073709551615", "[[1, 2], [3]]"}) {
        literals.add(literal);
    }
    Seeds npy(root, "npy");
    for (const auto& [description, size] : std::vector<std::pair<std::string, std::size_t>>{
             {"{'descr': '<f8', 'fortran_order': False, 'shape': (2, 3), }", 48},
             {"{'descr': '>i2', 'fortran_order': True, 'shape': (3,), }", 6},
             {"{'descr': '|b1', 'fortran_order': False, 'shape': (), }", 1},
             {"{'descr': '<U4', 'fortran_order': False, 'shape': (), }", 16},
             {"{'descr': '<c16', 'fortran_order': False, 'shape': (0, 2), }", 0}}) {
        const std::string text = description + std::string(117 - description.size(), ' ') + "\n";
        npy.add("\x93NUMPY" + std::string("\1\0", 2) + wire::little(text.size(), 2) + text + std::string(size, 'A'));
        npy.add("\x93NUMPY" + std::string("\3\0", 2) + wire::little(text.size(), 4) + text + std::string(size, 'A'));
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::cerr << "usage: krutil_fuzz_seeds DIRECTORY\n";
        return 2;
    }
    const std::filesystem::path root = argv[1];
    writeMessages(root);
    writeSessions(root);
    writeArguments(root);
    return 0;
}
