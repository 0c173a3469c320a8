#include "krutil_protobuf/support/Goldens.hpp"

#include <google/protobuf/descriptor.h>
#include <google/protobuf/io/coded_stream.h>
#include <google/protobuf/io/zero_copy_stream_impl_lite.h>
#include <google/protobuf/wire_format_lite.h>

#include <algorithm>
#include <bit>
#include <iomanip>
#include <sstream>
#include <stdexcept>

namespace goldens {
namespace {

using google::protobuf::Descriptor;
using google::protobuf::FieldDescriptor;
using google::protobuf::internal::WireFormatLite;
using google::protobuf::io::CodedInputStream;
using transport::FrameContent;

std::string hex(std::uint64_t value, int digits) {
    std::ostringstream out;
    out << std::hex << std::setfill('0') << std::setw(digits) << value;
    return out.str();
}

// Writes one line for each field of a message, nested ones indented below theirs.
class FieldReader {
  public:
    FieldReader(std::ostream& out, const std::string& bytes) : out_(out), bytes_(bytes) {}

    void read(const Descriptor& message) { readMessage(message, 0, bytes_.size(), "", 1); }

  private:
    void readMessage(const Descriptor& message, std::size_t begin, std::size_t end, const std::string& path,
                     int depth) {
        std::map<int, int> seen;
        while (begin < end) {
            const std::size_t start = begin;
            const auto key = static_cast<std::uint32_t>(readVarint(begin));
            const int number = WireFormatLite::GetTagFieldNumber(key);
            const FieldDescriptor* field = message.FindFieldByNumber(number);
            std::string name = path + (field != nullptr ? std::string(field->name()) : "unknown");
            if (field != nullptr && field->is_repeated()) {
                name += "[" + std::to_string(seen[number]++) + "]";
            }
            out_ << "  " << hex(start, 4) << std::string(static_cast<std::size_t>(2 * depth - 1), ' ') << name << " #"
                 << number << ' ';
            readValue(field, WireFormatLite::GetTagWireType(key), begin, name, depth);
        }
    }

    void readValue(const FieldDescriptor* field, WireFormatLite::WireType wireType, std::size_t& begin,
                   const std::string& name, int depth) {
        switch (wireType) {
            case WireFormatLite::WIRETYPE_VARINT:
                out_ << "varint " << varintText(field, readVarint(begin)) << '\n';
                return;
            case WireFormatLite::WIRETYPE_FIXED64: {
                const std::uint64_t bits = readFixed(begin, 8);
                out_ << "fixed64 " << doubleText(bits) << '\n';
                return;
            }
            case WireFormatLite::WIRETYPE_FIXED32:
                out_ << "fixed32 " << readFixed(begin, 4) << '\n';
                return;
            case WireFormatLite::WIRETYPE_LENGTH_DELIMITED: {
                const std::size_t length = readVarint(begin);
                const std::size_t end = begin + length;
                out_ << "length-delimited " << length << " bytes";
                readDelimited(field, begin, end, name, depth);
                begin = end;
                return;
            }
            default:
                throw std::runtime_error("a golden frame has a field of wire type " + std::to_string(wireType));
        }
    }

    void readDelimited(const FieldDescriptor* field, std::size_t begin, std::size_t end, const std::string& name,
                       int depth) {
        if (field != nullptr && field->message_type() != nullptr) {
            out_ << '\n';
            readMessage(*field->message_type(), begin, end, name + ".", depth + 1);
        } else if (field != nullptr && field->is_packable()) {
            out_ << " packed";
            while (begin < end) {
                out_ << ' '
                     << (field->cpp_type() == FieldDescriptor::CPPTYPE_DOUBLE ? doubleText(readFixed(begin, 8))
                                                                              : varintText(field, readVarint(begin)));
            }
            out_ << '\n';
        } else {
            out_ << ' ' << samples::quoted(bytes_.substr(begin, end - begin)) << '\n';
        }
    }

    static std::string varintText(const FieldDescriptor* field, std::uint64_t value) {
        if (field == nullptr) {
            return std::to_string(value);
        }
        switch (field->cpp_type()) {
            case FieldDescriptor::CPPTYPE_BOOL:
                return value != 0 ? "true" : "false";
            case FieldDescriptor::CPPTYPE_INT32:
            case FieldDescriptor::CPPTYPE_INT64:
                return std::to_string(static_cast<std::int64_t>(value));
            case FieldDescriptor::CPPTYPE_ENUM: {
                const auto number = static_cast<int>(static_cast<std::int64_t>(value));
                const auto* named = field->enum_type()->FindValueByNumber(number);
                return std::to_string(number) + (named != nullptr ? " " + std::string(named->name()) : "");
            }
            default:
                return std::to_string(value);
        }
    }

    static std::string doubleText(std::uint64_t bits) {
        std::ostringstream out;
        out << std::setprecision(17) << std::bit_cast<double>(bits) << " 0x" << hex(bits, 16);
        return out.str();
    }

    std::uint64_t readVarint(std::size_t& begin) const {
        std::uint64_t value = 0;
        for (unsigned int shift = 0;; shift += 7) {
            const auto byte = static_cast<unsigned char>(bytes_.at(begin++));
            value |= static_cast<std::uint64_t>(byte & 0x7F) << shift;
            if ((byte & 0x80) == 0) {
                return value;
            }
        }
    }

    std::uint64_t readFixed(std::size_t& begin, int size) const {
        std::uint64_t value = 0;
        for (int i = 0; i < size; ++i) {
            value |= static_cast<std::uint64_t>(static_cast<unsigned char>(bytes_.at(begin++))) << (8 * i);
        }
        return value;
    }

    std::ostream& out_;
    const std::string& bytes_;
};

void renderBytes(std::ostream& out, const std::string& bytes) {
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        if (i % 32 == 0) {
            out << (i == 0 ? "  " : "\n  ") << hex(i, 4) << " |";
        }
        out << ' ' << hex(static_cast<unsigned char>(bytes[i]), 2);
    }
    if (!bytes.empty()) {
        out << '\n';
    }
}

void renderFrame(std::ostream& out, const FrameContent& frame) {
    out << "frame " << frame.index << (frame.tagged ? " tagged" : " data") << " type " << static_cast<int>(frame.type)
        << " stream " << frame.streamID << " size " << frame.bytes.size();
    if (frame.tagged) {
        out << " tag " << frame.tag;
    }
    out << '\n';
    renderBytes(out, frame.bytes);
    if (frame.tagged) {
        const std::string& message = samples::sampleSet(frame.tag).message;
        const auto* descriptor = google::protobuf::DescriptorPool::generated_pool()->FindMessageTypeByName(message);
        if (descriptor == nullptr) {
            throw std::runtime_error("no message named " + message + " is linked");
        }
        FieldReader(out, frame.bytes).read(*descriptor);
    }
}

std::string word(std::istream& in, const char* expected) {
    std::string found;
    in >> found;
    if (*expected != '\0' && found != expected) {
        throw std::runtime_error("a golden file should say \"" + std::string(expected) + "\" where it says \"" + found +
                                 "\"");
    }
    return found;
}

template <class Number>
Number number(std::istream& in, const char* name) {
    word(in, name);
    Number value{};
    in >> value;
    return value;
}

FrameContent parseFrame(std::istream& in, std::size_t& size) {
    FrameContent frame;
    in >> frame.index;
    frame.tagged = word(in, "") == "tagged";
    frame.type = static_cast<transport::FrameType>(number<int>(in, "type"));
    frame.streamID = number<transport::StreamID>(in, "stream");
    size = number<std::size_t>(in, "size");
    if (frame.tagged) {
        frame.tag = number<std::string>(in, "tag");
    }
    return frame;
}

}  // namespace

std::filesystem::path directory() {
    return KRUTIL_GOLDEN_DIR;
}

std::filesystem::path fileOf(const std::string& serializer) {
    std::string name = serializer;
    name.erase(std::unique(name.begin(), name.end(), [](char a, char b) { return a == ':' && b == ':'; }), name.end());
    std::replace(name.begin(), name.end(), ':', '.');
    return directory() / (name + ".txt");
}

std::string render(const samples::SampleSet& set, const std::shared_ptr<const transport::Registry>& registry) {
    std::ostringstream out;
    out << "# Frames of " << set.serializer << ", message " << set.message
        << ". Written by krutil_regenerate_goldens; do not edit.\n";
    for (const samples::Sample& sample : set.samples) {
        out << "\nsample " << sample.name << '\n';
        for (const FrameContent& frame :
             transport::writtenFrames(*registry->find(set.serializer), sample.object, registry)) {
            renderFrame(out, frame);
        }
    }
    return out.str();
}

std::map<std::string, std::vector<FrameContent>> parse(const std::string& text) {
    std::map<std::string, std::vector<FrameContent>> parsed;
    std::vector<FrameContent>* sample = nullptr;
    std::size_t missing = 0;
    std::istringstream in(text);
    for (std::string line; std::getline(in, line);) {
        std::istringstream words(line);
        const std::string first = word(words, "");
        if (first == "sample") {
            sample = &parsed[word(words, "")];
        } else if (first == "frame" && sample != nullptr) {
            sample->push_back(parseFrame(words, missing));
        } else if (missing > 0 && word(words, "") == "|") {
            for (std::string byte; words >> byte; --missing) {
                sample->back().bytes += static_cast<char>(std::stoi(byte, nullptr, 16));
            }
        }
    }
    if (missing != 0 || sample == nullptr) {
        throw std::runtime_error("a golden file lacks " + std::to_string(missing) + " bytes of its last frame");
    }
    return parsed;
}

}  // namespace goldens
