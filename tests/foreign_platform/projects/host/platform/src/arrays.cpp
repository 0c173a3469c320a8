#include <cstdlib>
#include <cstring>
#include <new>
#include <stdexcept>

#include "foundation/korveldata/Buffer.hpp"
#include "foundation/korveldata/protobuf/SerializationContext.hpp"

namespace foundation::korveldata {

namespace {

// The size lies before the bytes, in as much room as keeps them aligned.
constexpr std::size_t room = alignof(std::max_align_t);

}  // namespace

char* newBuffer(unsigned long size) {
    char* block = static_cast<char*>(std::malloc(room + size));
    if (block == nullptr) {
        throw std::bad_alloc();
    }
    std::memcpy(block, &size, sizeof size);
    return block + room;
}

void deleteBuffer(char* buffer) {
    std::free(buffer - room);
}

unsigned long sizeOf(const char* buffer) {
    unsigned long size = 0;
    std::memcpy(&size, buffer - room, sizeof size);
    return size;
}

namespace protobuf {

SerializationContext::SerializationContext(ArrayFactory& factory, bool shareable, bool /*dense*/,
                                           std::shared_ptr<DataFrameWriter> writer,
                                           std::shared_ptr<DataFrameReader> reader)
    : factory_(factory), shareable_(shareable), writer_(std::move(writer)), reader_(std::move(reader)) {}

std::unique_ptr<KORVEL_Array> SerializationContext::convertToProtobuf(const Array& array) {
    auto message = createKORVEL_Array();
    message->set_code(array.code());
    message->mutable_extents()->Add(array.extents().begin(), array.extents().end());
    for (std::size_t i = 0; i < array.planes().size(); ++i) {
        const Array::Plane& plane = array.planes()[i];
        auto* described = message->add_planes();
        described->set_size(sizeOf(plane.get()));
        if (writer_ != nullptr && shareable_) {
            std::unique_ptr<char[], std::function<void(char*)>> shared(const_cast<char*>(plane.get()),
                                                                       [plane](char*) {});
            described->set_place(writer_->write(std::move(shared), described->size(), array.code()));
        } else {
            described->set_bytes(array.bytes(i));
        }
    }
    return message;
}

Array SerializationContext::convertFromProtobuf(std::unique_ptr<KORVEL_Array> message) {
    std::vector<Array::Plane> planes;
    for (const auto& described : message->planes()) {
        if (described.has_place()) {
            auto buffer = reader_->read(described.place());
            void (*const release)(char*) = buffer.get_deleter();
            planes.emplace_back(buffer.release(), [release](const char* last) { release(const_cast<char*>(last)); });
        } else {
            planes.push_back(factory_.plane(described.bytes()));
        }
        if (sizeOf(planes.back().get()) != described.size()) {
            throw std::runtime_error("a plane of another size");
        }
    }
    return Array(message->code(), {message->extents().begin(), message->extents().end()}, std::move(planes));
}

}  // namespace protobuf

}  // namespace foundation::korveldata
