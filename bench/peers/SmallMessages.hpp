// What people use instead for small messages: a line of text and an error, from the host's objects to bytes and back.
#pragma once

#include <boost/shared_ptr.hpp>
#include <cstddef>
#include <functional>
#include <string>

#include "cmddistributor/RuntimeException.hpp"
#include "codec/CodecSamples.hpp"
#include "krutil/io/TextBaseEvent.hpp"

namespace bench {

using Line = krutil::io::TextBaseEvent;
using Error = cmddistributor::RuntimeException;

/// One format. Text is UTF-8 in all of them, converted as the product converts it.
struct SmallFormat {
    std::string name;
    std::function<void(const Line& line, const TakeBytes& take)> writeLine;
    std::function<boost::shared_ptr<const Line>(const char* bytes, std::size_t size)> readLine;
    std::function<void(const Error& error, const TakeBytes& take)> writeError;
    std::function<Error(const char* bytes, std::size_t size)> readError;
};

SmallFormat capnProtoFormat();
SmallFormat flatBuffersFormat();
SmallFormat messagePackFormat();
SmallFormat jsonFormat();

}  // namespace bench
