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
#include <random>
#include <string_view>
#include <utility>

#include "foundation/core/posix/writeFully.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil/arrays/ArrayText.hpp"
#include "krutil/arrays/NpyHeader.hpp"
#include "krutil/base/ExitCode.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;

using foundation::korveldata::Array;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;

static_assert(std::endian::native == std::endian::little, "elements are little-endian in arrays and in files");

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

// A descr taken apart: "<f8" is 'f', 8 and little-endian.
struct Description {
    char kind = 0;
    std::size_t size = 0;
    bool swapped = false;
};

Description describe(const NpyHeader& header, const std::string& name) {
    const std::string& descr = header.descr;
    constexpr std::string_view orders = "<>|=";
    Description description;
    const bool hasOrder = !descr.empty() && orders.find(descr[0]) != std::string_view::npos;
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
    fail("cannot read " + name + ": its elements are of type " + header.quotedDescr() + ", which cannot be sent" +
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

Array textOf(std::string_view bytes, const NpyHeader& header, const Description& description, const std::string& name) {
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

}  // namespace

Array readNpy(const std::string& path) {
    const std::string name = "'" + path + "'";
    const auto mapping = std::make_shared<const Mapping>(path);
    const std::string_view bytes = mapping->bytes();
    const NpyHeader header = readNpyHeader(bytes, name);
    const Description description = describe(header, name);
    if (description.kind == 'U') {
        return textOf(bytes, header, description, name);
    }
    const auto* const dtype = std::find_if(dtypes.begin(), dtypes.end(), [&](const Dtype& candidate) {
        return candidate.kind == description.kind && candidate.size == description.size;
    });
    if (dtype == dtypes.end()) {
        fail("cannot read " + name + ": its elements are of type " + header.quotedDescr() + ", which cannot be sent");
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
        const std::string header = npyHeaderText("<U" + std::to_string(stored.size()), false, {});
        put(header.data(), header.size());
        put(reinterpret_cast<const char*>(stored.data()), stored.size() * bytesOfCharacter);
    } else {
        const Dtype& dtype = *dtypeOf(array.elementType());
        const std::string header =
            npyHeaderText((dtype.size == 1 ? "|" : "<") + std::string(1, dtype.kind) + std::to_string(dtype.size),
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
