#include "foundation/korveldata/Array.hpp"

#include <algorithm>
#include <array>
#include <cstring>
#include <limits>
#include <utility>

#include "foundation/korveldata/ArrayStorage.hpp"
#include "foundation/korveldata/describe.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace foundation::korveldata {

using detail::ArrayStorage;
using vantor::carrier::framing::BufferAllocator;
using vantor::carrier::framing::FrameBuffer;

namespace {

/// What data() of an array without elements points to; nobody reads or writes it.
alignas(64) char noElements[64];

constexpr std::uint64_t largest = std::numeric_limits<std::int64_t>::max();

/// Compares a row-major array with a column-major one: walks the first in memory order and keeps the position of the
/// same index in the second up to date.
bool sameAcrossOrders(const char* rowMajor, const char* columnMajor, std::span<const std::uint64_t> dimensions,
                      std::size_t elementBytes, std::uint64_t elements) {
    std::array<std::uint64_t, maxDimensions> index{};
    std::array<std::uint64_t, maxDimensions> stride{};
    std::uint64_t step = elementBytes;
    for (std::size_t i = 0; i < dimensions.size(); ++i) {
        stride[i] = step;
        step *= dimensions[i];
    }
    for (std::uint64_t n = 0; n < elements; ++n) {
        if (std::memcmp(rowMajor, columnMajor, elementBytes) != 0) {
            return false;
        }
        rowMajor += elementBytes;
        for (std::size_t i = dimensions.size(); i-- > 0;) {
            columnMajor += stride[i];
            if (++index[i] < dimensions[i]) {
                break;
            }
            columnMajor -= stride[i] * dimensions[i];
            index[i] = 0;
        }
    }
    return true;
}

}  // namespace

std::uint64_t checkedSizeInBytes(ElementType type, std::span<const std::uint64_t> dimensions) {
    const std::size_t elementBytes = elementSize(type);
    if (elementBytes == 0) {
        throw ArrayFormatError("Array: elements of type " + std::string(elementTypeName(type)) + " (code " +
                               std::to_string(static_cast<int>(type)) + ") are not supported");
    }
    if (dimensions.size() > maxDimensions) {
        throw ArrayFormatError("Array: " + std::to_string(dimensions.size()) + " dimensions; at most " +
                               std::to_string(maxDimensions) + " are supported");
    }
    std::uint64_t bytes = elementBytes;
    bool overflow = false;
    bool empty = false;
    for (const std::uint64_t dimension : dimensions) {
        if (dimension > largest) {
            throw ArrayFormatError("Array: a dimension of " + std::to_string(dimension) + "; at most " +
                                   std::to_string(largest) + " is supported");
        }
        empty = empty || dimension == 0;
        overflow = overflow || __builtin_mul_overflow(bytes, dimension, &bytes) || bytes > largest;
    }
    if (empty) {
        return 0;
    }
    if (overflow) {
        throw ArrayFormatError("Array: " + describe(type, dimensions) + " is more than " + std::to_string(largest) +
                               " bytes");
    }
    return bytes;
}

Array::Array() noexcept = default;
Array::~Array() = default;
Array::Array(const Array& other) = default;

Array& Array::operator=(const Array& other) {
    return *this = Array(other);
}

Array::Array(Array&& other) noexcept
    : type_(other.type_),
      order_(other.order_),
      dimensions_(std::move(other.dimensions_)),
      storage_(std::move(other.storage_)) {
    other.becomeEmpty();
}

Array& Array::operator=(Array&& other) noexcept {
    if (this != &other) {
        type_ = other.type_;
        order_ = other.order_;
        dimensions_ = std::move(other.dimensions_);
        storage_ = std::move(other.storage_);
        other.becomeEmpty();
    }
    return *this;
}

Array::Array(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
             boost::intrusive_ptr<ArrayStorage> storage)
    : type_(type), order_(order), dimensions_(dimensions.begin(), dimensions.end()), storage_(std::move(storage)) {}

Array Array::overMemory(ElementType type, const std::vector<std::uint64_t>& dimensions, MemoryOrder order,
                        const void* elements, std::shared_ptr<const void> owner) {
    if (checkedSizeInBytes(type, dimensions) == 0) {
        return Array(type, dimensions, order, nullptr);
    }
    if (elements == nullptr) {
        throw ArrayFormatError("Array: " + describe(type, dimensions) + " over a null address");
    }
    return Array(type, dimensions, order,
                 ArrayStorage::overMemory(static_cast<const char*>(elements), std::move(owner)));
}

void Array::becomeEmpty() noexcept {
    type_ = ElementType::Double;
    order_ = MemoryOrder::RowMajor;
    dimensions_.assign(2, 0);
    storage_.reset();
}

std::uint64_t Array::numberOfElements() const noexcept {
    std::uint64_t elements = 1;
    for (const std::uint64_t dimension : dimensions_) {
        elements *= dimension;
    }
    return elements;
}

std::uint64_t Array::sizeInBytes() const noexcept {
    return numberOfElements() * elementSize(type_);
}

const char* Array::data() const noexcept {
    return storage_ ? storage_->data() : noElements;
}

bool Array::writableInPlace() const noexcept {
    return !storage_ || storage_->writableInPlace();
}

char* Array::mutableData() {
    if (!storage_) {
        return noElements;
    }
    if (!storage_->writableInPlace()) {
        const std::uint64_t size = sizeInBytes();
        boost::intrusive_ptr<ArrayStorage> own = ArrayStorage::allocate(size);
        std::memcpy(own->data(), storage_->data(), size);
        storage_ = std::move(own);
    }
    return storage_->data();
}

FrameBuffer Array::lendBuffer() const {
    if (!storage_) {
        return BufferAllocator::makeFrameBuffer(0);
    }
    const std::uint64_t size = sizeInBytes();
    boost::intrusive_ptr<ArrayStorage> share = storage_;
    char* const address = BufferAllocator::adopt(share->data(), size, &ArrayStorage::dropShare, share.get());
    share.detach();
    return {std::unique_ptr<char[], std::function<void(char*)>>(address, &BufferAllocator::release), size};
}

std::u16string Array::toText() const {
    if (type_ != ElementType::Char16) {
        throw ArrayFormatError("Array: text asked of " + describe(type_, dimensions()));
    }
    std::u16string text(numberOfElements(), u'\0');
    std::memcpy(text.data(), data(), sizeInBytes());
    return text;
}

bool operator==(const Array& left, const Array& right) {
    if (left.type_ != right.type_ || left.dimensions_ != right.dimensions_) {
        return false;
    }
    const std::uint64_t elements = left.numberOfElements();
    if (elements == 0) {
        return true;
    }
    const auto extended = std::count_if(left.dimensions_.begin(), left.dimensions_.end(),
                                        [](std::uint64_t dimension) { return dimension > 1; });
    if (left.order_ == right.order_ || extended <= 1) {
        return left.data() == right.data() || std::memcmp(left.data(), right.data(), left.sizeInBytes()) == 0;
    }
    const bool leftFirst = left.order_ == MemoryOrder::RowMajor;
    const Array& rowMajor = leftFirst ? left : right;
    const Array& columnMajor = leftFirst ? right : left;
    return sameAcrossOrders(rowMajor.data(), columnMajor.data(), left.dimensions(), elementSize(left.type_), elements);
}

}  // namespace foundation::korveldata
