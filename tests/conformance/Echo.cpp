// Reads messages from standard input, as they travel in a session, and writes the objects that they become to standard
// output in the same form. Ends with status 1 and a line on standard error at the first message that is refused.

#include <unistd.h>

#include <array>
#include <cstring>
#include <exception>
#include <iostream>
#include <string>

#include "conformance/vectors/Layout.hpp"

namespace {

void writeAgain(const conformance::Reading& reading, const std::shared_ptr<transport::Registry>& registry,
                unsigned long number) {
    if (!reading.accepted) {
        throw std::runtime_error("message " + std::to_string(number) + ": cannot read \"" + reading.type +
                                 "\": " + reading.refusal);
    }
    const auto stream = std::make_shared<transport::RecordingStream>();
    samples::write(*registry->find(reading.type), reading.object, reading.stream, 1, stream, registry,
                   transport::SerializationContext());
    std::cout << conformance::bytesOf(transport::contentOf(stream->frames));
}

}  // namespace

int main() try {
    conformance::StreamOfMessages messages;
    unsigned long number = 0;
    std::array<char, 65'536> buffer{};
    ssize_t count = 0;
    while ((count = ::read(STDIN_FILENO, buffer.data(), buffer.size())) > 0) {
        messages.feed({buffer.data(), static_cast<std::size_t>(count)},
                      [&](const conformance::Reading& reading) { writeAgain(reading, messages.registry(), ++number); });
    }
    if (count < 0) {
        throw std::runtime_error(std::string("cannot read standard input: ") + std::strerror(errno));
    }
    if (!messages.atBoundary()) {
        throw std::runtime_error("standard input ends within message " + std::to_string(number + 1));
    }
    if (!std::cout.flush()) {
        throw std::runtime_error("cannot write to standard output");
    }
    return 0;
} catch (const std::exception& error) {
    std::cerr << "krutil_conformance_echo: " << error.what() << '\n';
    return 1;
}
