#include "common/ProtobufLog.hpp"

#include <google/protobuf/stubs/logging.h>
#include <unistd.h>

#include <chrono>
#include <string>
#include <string_view>

#include "common/RateLimit.hpp"

namespace apps {
namespace {

void logLine(google::protobuf::LogLevel level, const char* file, int line, const std::string& message) {
    static RateLimit limit(10, std::chrono::minutes(1));
    const auto leftOut = limit.ask(RateLimit::Clock::now());
    if (!leftOut && level != google::protobuf::LOGLEVEL_FATAL) {
        return;
    }
    std::string text;
    if (leftOut.value_or(0) > 0) {
        text = "protobuf: " + std::to_string(*leftOut) + " earlier lines were left out\n";
    }
    std::string_view name = file;
    name.remove_prefix(name.rfind('/') + 1);
    text += "protobuf: " + message + " (";
    text += name;
    text += ":" + std::to_string(line) + ")\n";
    // One call a line, so that lines of several threads do not mix; a standard error that cannot be written is no
    // reason to stop.
    if (::write(STDERR_FILENO, text.data(), text.size()) < 0) {
        return;
    }
}

}  // namespace

void installProtobufLog() {
    google::protobuf::SetLogHandler(&logLine);
}

}  // namespace apps
