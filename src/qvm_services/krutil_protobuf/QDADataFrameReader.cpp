#include "QDADataFrameReader.hpp"

#include <typeinfo>

#include "foundation/core/diag/terminate.hpp"
#include "foundation/vantor/carrier/framing/DataFrame.hpp"

namespace krutil::protobuf_serializer::detail {

using foundation::vantor::carrier::framing::DataFrame;

QDADataFrameReader::QDADataFrameReader(foundation::msg_svc::transport::layers::message::Message& message)
    : message_(message) {}

std::unique_ptr<char[], void (*)(char*)> QDADataFrameReader::read(unsigned long dataID) {
    if (dynamic_cast<const DataFrame*>(message_.frame(dataID).get()) == nullptr) {
        throw std::bad_cast();
    }
    auto buffer = message_.release(dataID)->releaseBuffer().first;
    const auto* deleter = buffer.get_deleter().target<void (*)(char*)>();
    if (deleter == nullptr) {
        foundation::core::diag::terminate(
            "The deleter of a data frame is not a plain function", "QDADataFrameReader", 34,
            "virtual std::unique_ptr<char [], void (*)(char*)> "
            "krutil::protobuf_serializer::detail::QDADataFrameReader::read(unsigned long)");
    }
    void (*const release)(char*) = *deleter;
    return {buffer.release(), release};
}

}  // namespace krutil::protobuf_serializer::detail
