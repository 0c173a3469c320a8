#include "krutil/arrays/NpyFile.hpp"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <optional>
#include <random>
#include <span>
#include <string_view>
#include <utility>
#include <vector>

#include "foundation/core/posix/writeFully.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil/arrays/ArrayText.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;

using foundation::korveldata::Array;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;

static_assert(std::endian::native == std::endian::little, "elements are little-endian in arrays and in files");

constexpr std::string_view magic("\x93NUMPY", 6);
// Magic and the two bytes of the version.
constexpr std::size_t versionEnd = 8;
// Arrays that can be read here have short headers; records with many fields have long ones.
constexpr std::size_t longestHeader = 1U << 16;
// NumPy aligns the elements in the file to this.
constexpr std::size_t alignment = 64;
constexpr std::size_t bytesOfCharacter = 4;

struct Dtype {
    char kind;
    std::size_t size;
    ElementType type;
};

constexpr std::array dtypes{Dtype{'b', 1, ElementType::Bool},          Dtype{'i', 1, ElementType::Int8},
                            Dtype{'u', 1, ElementType::UInt8},         Dtype{'i', 2, ElementType::Int16},
                            Dtype{'u', 2, ElementType::UInt16},        Dtype{'i', 4, ElementType::Int32},
                            Dtype{'u', 4, ElementType::UInt32},        Dtype{'i', 8, ElementType::Int64},
                            Dtype{'u', 8, ElementType::UInt64},        Dtype{'f', 4, ElementType::Single},
                            Dtype{'f', 8, ElementType::Double},        Dtype{'c', 8, ElementType::ComplexSingle},
                            Dtype{'c', 16, ElementType::ComplexDouble}};

[[noreturn]] void fail(const std::string& sentence) {
    throw Failure(ExitCode::Usage, sentence);
}

[[noreturn]] void failSystem(const std::string& what) {
    fail(what + ": " + std::strerror(errno));
}

std::string quoted(std::string_view text) {
    constexpr std::size_t longest = 60;
    return "'" + std::string(text.substr(0, longest)) + (text.size() > longest ? "...'" : "'");
}

// A whole file, mapped.
class Mapping {
  public:
    explicit Mapping(const std::string& path) {
        const std::string name = "'" + path + "'";
        // A FIFO without a writer must not hold up the program before it is refused.
        const posix::OwnedDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
        if (!file) {
            failSystem("cannot open " + name);
        }
        struct stat status {};
        if (::fstat(file.get(), &status) != 0) {
            failSystem("cannot read " + name);
        }
        if (!S_ISREG(status.st_mode)) {
            fail("cannot read " + name + ": it is no regular file");
        }
        size_ = static_cast<std::size_t>(status.st_size);
        if (size_ == 0) {
            return;
        }
        void* const address = ::mmap(nullptr, size_, PROT_READ, MAP_PRIVATE, file.get(), 0);
        if (address == MAP_FAILED) {
            failSystem("cannot map " + name);
        }
        address_ = static_cast<const char*>(address);
    }
    ~Mapping() {
        if (address_ != nullptr) {
            ::munmap(const_cast<char*>(address_), size_);
        }
    }
    Mapping(const Mapping&) = delete;
    Mapping& operator=(const Mapping&) = delete;

    std::string_view bytes() const noexcept { return {address_, size_}; }

  private:
    const char* address_ = nullptr;
    std::size_t size_ = 0;
};

// What a file says about its elements.
struct Header {
    std::string descr;
    bool columnMajor = false;
    std::vector<std::uint64_t> shape;
    std::size_t end = 0;  // where the elements begin
};

// Reads the header's text: a Python dictionary of exactly three keys, in any order.
class HeaderParser {
  public:
    HeaderParser(std::string_view text, const std::string& name) : text_(text), name_(name) {}

    Header parse() {
        Header header;
        std::array<bool, 3> seen{};
        const auto once = [&](std::size_t key, const std::string& text) {
            if (std::exchange(seen[key], true)) {
                failHere("the key '" + text + "' a second time");
            }
        };
        expect('{');
        while (!accept('}')) {
            const std::string key = parseString();
            expect(':');
            if (key == "descr") {
                once(0, key);
                header.descr = parseDescr();
            } else if (key == "fortran_order") {
                once(1, key);
                header.columnMajor = parseBool();
            } else if (key == "shape") {
                once(2, key);
                header.shape = parseShape();
            } else {
                failHere("the unknown key " + quoted(key));
            }
            if (!accept(',')) {
                expect('}');
                break;
            }
        }
        skipSpace();
        if (position_ != text_.size()) {
            failHere("more text after the dictionary");
        }
        if (!std::all_of(seen.begin(), seen.end(), [](bool value) { return value; })) {
            failHere("not all of the keys 'descr', 'fortran_order' and 'shape'");
        }
        return header;
    }

  private:
    [[noreturn]] void failHere(const std::string& what) const {
        fail("cannot read " + name_ + ": its header has " + what + " at byte " + std::to_string(position_));
    }

    void skipSpace() {
        while (position_ < text_.size() && (text_[position_] == ' ' || text_[position_] == '\n')) {
            ++position_;
        }
    }

    bool accept(char c) {
        skipSpace();
        if (position_ < text_.size() && text_[position_] == c) {
            ++position_;
            return true;
        }
        return false;
    }

    void expect(char c) {
        if (!accept(c)) {
            failHere(std::string("no '") + c + "'");
        }
    }

    std::string parseString() {
        skipSpace();
        const char quote = position_ < text_.size() ? text_[position_] : '\0';
        if (quote != '\'' && quote != '"') {
            failHere("no text in quotes");
        }
        const auto end = text_.find(quote, position_ + 1);
        const auto content = text_.substr(position_ + 1, end == text_.npos ? 0 : end - position_ - 1);
        if (end == text_.npos || content.find('\\') != content.npos) {
            failHere("a text that does not end or has escapes");
        }
        position_ = end + 1;
        return std::string(content);
    }

    std::string parseDescr() {
        skipSpace();
        if (position_ < text_.size() && text_[position_] == '[') {
            fail("cannot read " + name_ +
                 ": its elements are records, which cannot be sent; send their fields one by one");
        }
        return parseString();
    }

    bool parseBool() {
        skipSpace();
        for (const auto& [word, value] :
             {std::pair{std::string_view("True"), true}, {std::string_view("False"), false}}) {
            if (text_.substr(position_, word.size()) == word) {
                position_ += word.size();
                return value;
            }
        }
        failHere("neither True nor False");
    }

    std::vector<std::uint64_t> parseShape() {
        std::vector<std::uint64_t> shape;
        expect('(');
        bool comma = true;
        while (!accept(')')) {
            if (!comma) {
                failHere("no ','");
            }
            skipSpace();
            std::uint64_t extent = 0;
            const auto* const begin = text_.data() + position_;
            const auto [end, error] = std::from_chars(begin, text_.data() + text_.size(), extent);
            if (error != std::errc()) {
                failHere("no extent that fits 64 bits");
            }
            shape.push_back(extent);
            position_ += static_cast<std::size_t>(end - begin);
            comma = accept(',');
        }
        if (shape.size() == 1 && !comma) {
            failHere("a number in parentheses, which is no shape,");
        }
        return shape;
    }

    std::string_view text_;
    const std::string& name_;
    std::size_t position_ = 0;
};

std::size_t littleEndian(std::string_view bytes) {
    std::size_t number = 0;
    for (std::size_t i = bytes.size(); i-- > 0;) {
        number = number << 8U | static_cast<unsigned char>(bytes[i]);
    }
    return number;
}

Header readHeader(std::string_view bytes, const std::string& name) {
    const auto require = [&](std::size_t end) {
        if (bytes.size() < end) {
            fail("cannot read " + name + ": it ends after " + std::to_string(bytes.size()) +
                 " bytes, in the middle of its header");
        }
    };
    if (bytes.substr(0, magic.size()) != magic) {
        fail("cannot read " + name + ": it is no .npy file (it does not begin with \"\\x93NUMPY\")");
    }
    require(versionEnd);
    const auto major = static_cast<unsigned char>(bytes[versionEnd - 2]);
    const auto minor = static_cast<unsigned char>(bytes[versionEnd - 1]);
    if (major < 1 || major > 3 || minor != 0) {
        fail("cannot read " + name + ": it has version " + std::to_string(major) + "." + std::to_string(minor) +
             " of the .npy format; 1.0, 2.0 and 3.0 are known here");
    }
    const std::size_t begin = versionEnd + (major == 1 ? 2 : 4);
    require(begin);
    const std::size_t length = littleEndian(bytes.substr(versionEnd, begin - versionEnd));
    require(begin + length);
    if (length > longestHeader) {
        fail("cannot read " + name + ": its header has " + std::to_string(length) + " bytes; at most " +
             std::to_string(longestHeader) + " are expected");
    }
    Header header = HeaderParser(bytes.substr(begin, length), name).parse();
    header.end = begin + length;
    return header;
}

// A descr taken apart: "<f8" is 'f', 8 and little-endian.
struct Description {
    char kind = 0;
    std::size_t size = 0;
    bool swapped = false;
};

Description describe(const std::string& descr, const std::string& name) {
    constexpr std::string_view orders = "<>|=";
    Description description;
    const bool hasOrder = !descr.empty() && orders.find(descr[0]) != orders.npos;
    const auto* const begin = descr.data() + (hasOrder ? 1 : 0);
    const auto* const end = descr.data() + descr.size();
    if (begin != end) {
        description.kind = *begin;
        const auto parsed = std::from_chars(begin + 1, end, description.size);
        if (parsed.ec == std::errc() && parsed.ptr == end) {
            description.swapped = descr[0] == '>' && description.size > 1;
            return description;
        }
    }
    fail("cannot read " + name + ": its elements are of type " + quoted(descr) + ", which cannot be sent" +
         (description.kind == 'O' ? "; Python objects stay in their process" : ""));
}

std::uint64_t checkedSize(std::uint64_t elements, std::uint64_t size, const std::string& name) {
    std::uint64_t bytes = 0;
    if (__builtin_mul_overflow(elements, size, &bytes)) {
        fail("cannot read " + name + ": it says that it has more than 2^64 bytes of elements");
    }
    return bytes;
}

void checkComplete(std::string_view bytes, std::size_t begin, std::uint64_t needed, const std::string& name) {
    if (bytes.size() - begin < needed) {
        fail("cannot read " + name + ": it is cut short: its header says " + std::to_string(needed) +
             " bytes of elements, " + std::to_string(bytes.size() - begin) + " are there");
    }
}

char32_t characterAt(const char* bytes, bool swapped) {
    std::array<unsigned char, bytesOfCharacter> b{};
    std::memcpy(b.data(), bytes, b.size());
    if (swapped) {
        std::reverse(b.begin(), b.end());
    }
    char32_t character = 0;
    std::memcpy(&character, b.data(), b.size());
    return character;
}

Array textOf(std::string_view bytes, const Header& header, const Description& description, const std::string& name) {
    if (!header.shape.empty()) {
        fail("cannot read " + name + ": it holds an array of texts; only a single text, of shape (), can be sent");
    }
    checkComplete(bytes, header.end, checkedSize(description.size, bytesOfCharacter, name), name);
    std::u16string text;
    for (std::size_t i = 0; i < description.size; ++i) {
        char32_t character = characterAt(bytes.data() + header.end + i * bytesOfCharacter, description.swapped);
        constexpr char32_t lastCharacter = 0x10FFFF;
        if (character > lastCharacter) {
            character = U'\uFFFD';
        }
        if (character < 0x10000) {
            text += static_cast<char16_t>(character);
        } else {
            text += static_cast<char16_t>(0xD800 + ((character - 0x10000) >> 10U));
            text += static_cast<char16_t>(0xDC00 + ((character - 0x10000) & 0x3FFU));
        }
    }
    // The room that the text does not use is zeros.
    text.resize(text.find_last_not_of(u'\0') + 1);
    return foundation::korveldata::ArrayFactory().createText(text);
}

bool isComplex(char kind) {
    return kind == 'c';
}

Array swappedCopy(const Array& array, const Description& description) {
    Array copy = array;
    char* bytes = copy.mutableData();
    const std::size_t unit = description.size / (isComplex(description.kind) ? 2 : 1);
    for (std::uint64_t left = copy.sizeInBytes() / unit; left > 0; --left, bytes += unit) {
        std::reverse(bytes, bytes + unit);
    }
    return copy;
}

const Dtype* dtypeOf(ElementType type) {
    const auto* const found =
        std::find_if(dtypes.begin(), dtypes.end(), [type](const Dtype& dtype) { return dtype.type == type; });
    return found == dtypes.end() ? nullptr : &*found;
}

std::u32string charactersOf(const std::u16string& text) {
    std::u32string characters;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const char32_t unit = text[i];
        const bool pair =
            unit >= 0xD800 && unit < 0xDC00 && i + 1 < text.size() && text[i + 1] >= 0xDC00 && text[i + 1] < 0xE000;
        // An unpaired surrogate is a character of its own for NumPy, too.
        characters += pair ? 0x10000 + ((unit - 0xD800) << 10U) + (static_cast<char32_t>(text[++i]) - 0xDC00) : unit;
    }
    return characters;
}

std::string headerText(const std::string& descr, bool columnMajor, std::span<const std::uint64_t> shape) {
    std::string text =
        "{'descr': '" + descr + "', 'fortran_order': " + (columnMajor ? "True" : "False") + ", 'shape': (";
    for (const std::uint64_t extent : shape) {
        text += std::to_string(extent) + ", ";
    }
    if (shape.size() > 1) {
        text.resize(text.size() - 2);
    } else if (!shape.empty()) {
        text.pop_back();
    }
    text += "), }";
    const std::size_t unpadded = versionEnd + 2 + text.size() + 1;
    text.append((alignment - unpadded % alignment) % alignment, ' ');
    text += '\n';
    std::string file(magic);
    file += {'\1', '\0', static_cast<char>(text.size() & 0xFFU), static_cast<char>(text.size() >> 8U)};
    return file + text;
}

}  // namespace

Array readNpy(const std::string& path) {
    const std::string name = "'" + path + "'";
    const auto mapping = std::make_shared<const Mapping>(path);
    const std::string_view bytes = mapping->bytes();
    const Header header = readHeader(bytes, name);
    const Description description = describe(header.descr, name);
    if (description.kind == 'U') {
        return textOf(bytes, header, description, name);
    }
    const auto* const dtype = std::find_if(dtypes.begin(), dtypes.end(), [&](const Dtype& candidate) {
        return candidate.kind == description.kind && candidate.size == description.size;
    });
    if (dtype == dtypes.end()) {
        fail("cannot read " + name + ": its elements are of type " + quoted(header.descr) + ", which cannot be sent");
    }
    try {
        checkComplete(bytes, header.end, foundation::korveldata::checkedSizeInBytes(dtype->type, header.shape), name);
        const Array array = Array::overMemory(dtype->type, header.shape,
                                              header.columnMajor ? MemoryOrder::ColumnMajor : MemoryOrder::RowMajor,
                                              bytes.data() + header.end, mapping);
        return description.swapped ? swappedCopy(array, description) : array;
    } catch (const foundation::korveldata::ArrayFormatError& error) {
        fail("cannot read " + name + ": " + error.what());
    }
}

bool npyCanHold(const Array& array, std::string& why) {
    if (isText(array) || dtypeOf(array.elementType()) != nullptr) {
        return true;
    }
    why = "NumPy has no type for " + arrayHeading(array);
    return false;
}

NpyOutput::NpyOutput(const std::string& path) : path_(path), target_(path) {
    const std::string cannot = "cannot write '" + path + "'";
    // Through symbolic links, which are to stay.
    const std::unique_ptr<char, void (*)(void*)> real(::realpath(path.c_str(), nullptr), &std::free);
    if (real) {
        target_ = real.get();
    }
    struct stat status {};
    if (::stat(target_.c_str(), &status) == 0 && !S_ISREG(status.st_mode)) {
        file_.reset(::open(target_.c_str(), O_WRONLY | O_CLOEXEC));
        if (!file_) {
            failSystem(cannot);
        }
        return;
    }
    std::random_device random;
    do {
        temporary_ = target_ + "." + std::to_string(random()) + ".tmp";
        file_.reset(::open(temporary_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666));
    } while (!file_ && errno == EEXIST);
    if (!file_) {
        temporary_.clear();
        failSystem(cannot);
    }
}

NpyOutput::NpyOutput(NpyOutput&& other) noexcept
    : path_(std::move(other.path_)),
      target_(std::move(other.target_)),
      temporary_(std::exchange(other.temporary_, {})),
      file_(std::move(other.file_)) {}

NpyOutput::~NpyOutput() {
    if (!temporary_.empty()) {
        ::unlink(temporary_.c_str());
    }
}

void NpyOutput::write(const Array& array) {
    const std::string cannot = "cannot write '" + path_ + "'";
    const auto put = [&](const char* bytes, std::size_t size) {
        if (!posix::writeFully(file_.get(), {bytes, size})) {
            failSystem(cannot);
        }
    };
    if (std::string why; !npyCanHold(array, why)) {
        fail(cannot + ": " + why);
    }
    if (isText(array)) {
        const std::u32string characters = charactersOf(array.toText());
        // NumPy has no text of zero characters; an empty one is a zero.
        const std::u32string stored = characters.empty() ? std::u32string(1, U'\0') : characters;
        const std::string header = headerText("<U" + std::to_string(stored.size()), false, {});
        put(header.data(), header.size());
        put(reinterpret_cast<const char*>(stored.data()), stored.size() * bytesOfCharacter);
    } else {
        const Dtype& dtype = *dtypeOf(array.elementType());
        const std::string header =
            headerText((dtype.size == 1 ? "|" : "<") + std::string(1, dtype.kind) + std::to_string(dtype.size),
                       array.order() == MemoryOrder::ColumnMajor, array.dimensions());
        put(header.data(), header.size());
        put(array.data(), array.sizeInBytes());
    }
    // Some file systems report a lack of room only here.
    if (::close(file_.release()) != 0) {
        failSystem(cannot);
    }
    if (!temporary_.empty()) {
        if (::rename(temporary_.c_str(), target_.c_str()) != 0) {
            failSystem(cannot);
        }
        temporary_.clear();
    }
}

}  // namespace krutil_client
