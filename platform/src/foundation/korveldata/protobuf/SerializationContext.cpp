#include "foundation/korveldata/protobuf/SerializationContext.hpp"

#include <bit>
#include <limits>
#include <stdexcept>
#include <utility>
#include <vector>

#include "foundation/korveldata/describe.hpp"
#include "foundation/vantor/carrier/framing/BufferAllocator.hpp"

namespace foundation::korveldata::protobuf {

// Elements are sent as they lie in memory.
static_assert(std::endian::native == std::endian::little, "the wire is little-endian");

namespace {

using vantor::carrier::framing::BufferAllocator;

MemoryOrder orderOf(const KORVEL_Array& message) {
    switch (message.order()) {
        case KORVEL_Array::ROW_MAJOR:
            return MemoryOrder::RowMajor;
        case KORVEL_Array::COLUMN_MAJOR:
            return MemoryOrder::ColumnMajor;
        default:
            throw ArrayFormatError("KORVEL_Array: memory order " + std::to_string(message.order()) +
                                   "; expected 1 (row-major) or 2 (column-major)");
    }
}

/// Whether an element of this type is one whatever its bytes are, alone and beside others.
bool anyBytesWillDo(ElementType type) {
    return type != ElementType::Bool && type != ElementType::Char16;
}

/// Bytes other than 0 and 1 would be undefined behaviour in whatever reads them as bool.
void requireBools(const Array& array) {
    unsigned char seen = 0;
    const char* const bytes = array.data();
    const std::uint64_t size = array.sizeInBytes();
    for (std::uint64_t i = 0; i < size; ++i) {
        seen = static_cast<unsigned char>(seen | static_cast<unsigned char>(bytes[i]));
    }
    if (seen > 1) {
        throw ArrayFormatError("KORVEL_Array: " + describe(array.elementType(), array.dimensions()) +
                               " with a byte that is neither 0 nor 1");
    }
}

}  // namespace

DataFrameWriter::~DataFrameWriter() = default;
DataFrameReader::~DataFrameReader() = default;
SerializationContextBase::~SerializationContextBase() = default;

std::unique_ptr<KORVEL_Array> createKORVEL_Array() {
    return std::make_unique<KORVEL_Array>();
}

SerializationContext::SerializationContext(ArrayFactory& factory, bool checkContent, bool everyBufferOutOfLine,
                                           std::shared_ptr<DataFrameWriter> writer,
                                           std::shared_ptr<DataFrameReader> reader)
    : factory_(factory),
      checkContent_(checkContent),
      everyBufferOutOfLine_(everyBufferOutOfLine),
      writer_(std::move(writer)),
      reader_(std::move(reader)) {}

SerializationContext::~SerializationContext() = default;

std::unique_ptr<KORVEL_Array> SerializationContext::convertToProtobuf(const Array& array) {
    std::unique_ptr<KORVEL_Array> message = createKORVEL_Array();
    const int type = static_cast<int>(array.elementType());
    message->set_elementtype(type);
    message->mutable_dimensions()->Add(array.dimensions().begin(), array.dimensions().end());
    message->set_order(array.order() == MemoryOrder::RowMajor ? KORVEL_Array::ROW_MAJOR : KORVEL_Array::COLUMN_MAJOR);

    const std::uint64_t bytes = array.sizeInBytes();
    if (writer_ && bytes >= (everyBufferOutOfLine_ ? 1 : outOfLineThreshold)) {
        vantor::carrier::framing::FrameBuffer lent = array.lendBuffer();
        message->set_dataid(writer_->write(std::move(lent.first), lent.second, type));
    } else {
        if (bytes > std::numeric_limits<int>::max()) {
            // What writing the message as a frame would say, before the elements are copied in vain.
            throw std::length_error("Unsupported Protobuf buffer size.");
        }
        message->set_inlineelements(array.data(), bytes);
    }
    return message;
}

Array SerializationContext::convertFromProtobuf(std::unique_ptr<KORVEL_Array> message) {
    if (!message) {
        throw std::invalid_argument("SerializationContext::convertFromProtobuf: no message");
    }
    const auto type = static_cast<ElementType>(message->elementtype());
    const std::span<const std::uint64_t> claimed(message->dimensions().data(),
                                                 static_cast<std::size_t>(message->dimensions_size()));
    const std::uint64_t expected = checkedSizeInBytes(type, claimed);
    const MemoryOrder order = orderOf(*message);
    const std::vector<std::uint64_t> dimensions(claimed.begin(), claimed.end());

    Array array;
    switch (message->elements_case()) {
        case KORVEL_Array::kInlineElements:
            if (message->inlineelements().size() != expected) {
                throw ArrayFormatError("KORVEL_Array: " + describe(type, claimed) + " needs " +
                                       std::to_string(expected) + " bytes; the message has " +
                                       std::to_string(message->inlineelements().size()));
            }
            array = factory_.createArray(type, dimensions, order, message->inlineelements().data());
            break;
        case KORVEL_Array::kDataID:
            if (!reader_) {
                throw ArrayFormatError("KORVEL_Array: the elements are in data frame " +
                                       std::to_string(message->dataid()) +
                                       ", but data frames are off (zero copy is disabled in this process)");
            }
            array = factory_.fromBuffer(type, dimensions, order, reader_->read(message->dataid()));
            if (!anyBytesWillDo(type) && BufferAllocator::isForeign(array.data())) {
                // What is checked, or read twice, must not change in between.
                array = factory_.createArray(type, dimensions, order, array.data());
            }
            break;
        default:
            throw ArrayFormatError("KORVEL_Array: " + describe(type, claimed) +
                                   " without elements: neither bytes nor a data ID");
    }
    if (checkContent_ && type == ElementType::Bool) {
        requireBools(array);
    }
    return array;
}

}  // namespace foundation::korveldata::protobuf
