// Conversion between an array and its message.
//
// A context serves the conversions of one message of a session and is then destroyed. It is not synchronised. The
// factory must outlive it; writer and reader are shared.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <unordered_map>

#include <boost/bimap.hpp>

#include "foundation.korveldata.protobuf.KORVEL_Array.pb.h"
#include "foundation/korveldata/Array.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "foundation/korveldata/ClassInfo.hpp"
#include "foundation/korveldata/protobuf/DataFrameReader.hpp"
#include "foundation/korveldata/protobuf/DataFrameWriter.hpp"
#include "foundation/korveldata/protobuf/SerializationContextBase.hpp"

namespace foundation::korveldata::protobuf {

/// Element buffers of this many bytes and more go to the writer, where there is one; smaller ones travel inside the
/// message. Measured between two threads over a Unix socket, from array to array: up to 1 KiB two copies cost less than
/// a second frame, at 1.5 KiB they cost the same, at 2 KiB the frame is ahead by 4 %, at 64 KiB by 30 to 40 %.
inline constexpr std::size_t outOfLineThreshold = 2048;

/// An empty message, to be filled and given to SerializationContext::convertFromProtobuf().
std::unique_ptr<KORVEL_Array> createKORVEL_Array();

/// Converts the arrays of one message: to their messages and back.
class SerializationContext : public SerializationContextBase {
  public:
    /// A name and the name that replaces it.
    using StringTable = std::unordered_map<std::string, std::string>;
    /// Class names and their ids, found by either.
    using ClassIdTable = boost::bimap<std::string, unsigned>;
    /// Classes by id.
    using ClassTable = std::map<unsigned, ClassInfo>;
    /// Object ids of the sender, and those of the receiver for them.
    using ObjectIdTable = std::map<std::uint64_t, std::uint64_t>;

    /// `checkContent`: arrays of bool are refused on the way in when a byte is neither 0 nor 1; this reads each byte of
    /// them once. Without it, a sender is trusted to have sent nothing else.
    /// `everyBufferOutOfLine`: the writer gets every buffer that has bytes, not only those from outOfLineThreshold on.
    /// `writer` may be null: then every array travels whole inside its message. `reader` may be null: then messages
    /// that refer to data IDs are refused.
    SerializationContext(ArrayFactory& factory, bool checkContent, bool everyBufferOutOfLine,
                         std::shared_ptr<DataFrameWriter> writer, std::shared_ptr<DataFrameReader> reader);
    ~SerializationContext() override;
    SerializationContext(const SerializationContext&) = delete;
    SerializationContext& operator=(const SerializationContext&) = delete;

    /// Describes `array`; its elements go to the writer without a copy (see Array::lendBuffer()), or are copied into
    /// the message. Never null. Throws what the writer throws, std::bad_alloc, and std::length_error when the elements
    /// would have to go into the message and no message can hold them.
    std::unique_ptr<KORVEL_Array> convertToProtobuf(const Array& array);

    /// The array that `message` describes. Elements that the reader has become the array's own without a copy; those
    /// inside the message are copied once, into aligned memory. Nothing is allocated before the description is checked,
    /// and never more than what arrived. Throws ArrayFormatError for anything but a complete description with exactly
    /// its bytes, std::invalid_argument for a null message, and what the reader throws.
    Array convertFromProtobuf(std::unique_ptr<KORVEL_Array> message);

    /// Makes the arrays that are converted from messages.
    ArrayFactory& factory() const noexcept { return factory_; }
    /// Whether bytes of arrays of bool are looked at on the way in.
    bool checkContent() const noexcept { return checkContent_; }
    /// Whether the writer gets buffers of any size.
    bool everyBufferOutOfLine() const noexcept { return everyBufferOutOfLine_; }
    /// Where elements go; may be null.
    const std::shared_ptr<DataFrameWriter>& writer() const noexcept { return writer_; }
    /// Where elements come from; may be null.
    const std::shared_ptr<DataFrameReader>& reader() const noexcept { return reader_; }

    /// Names of the sender that are replaced by others. Like the other three, a working table for arrays of objects:
    /// arrays of the types that ArrayFactory builds leave it empty.
    const StringTable& replacedNames() const noexcept { return replacedNames_; }
    /// Class names and their ids in this message.
    const ClassIdTable& classIds() const noexcept { return classIds_; }
    /// The classes in this message, by id.
    const ClassTable& classes() const noexcept { return classes_; }
    /// Object ids of the sender, and those of the receiver for them.
    const ObjectIdTable& objectIds() const noexcept { return objectIds_; }

  private:
    ArrayFactory& factory_;
    bool checkContent_;
    bool everyBufferOutOfLine_;
    std::shared_ptr<DataFrameWriter> writer_;
    std::shared_ptr<DataFrameReader> reader_;
    StringTable replacedNames_;
    ClassIdTable classIds_;
    ClassTable classes_;
    ObjectIdTable objectIds_;
};

}  // namespace foundation::korveldata::protobuf
