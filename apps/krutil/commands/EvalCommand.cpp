#include "krutil/commands/EvalCommand.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <string>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "krutil/base/Text.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;

std::string readAll(int fd, const std::string& name) {
    std::string text;
    std::array<char, 1U << 16> piece{};
    for (;;) {
        const auto got = ::read(fd, piece.data(), piece.size());
        if (got == 0) {
            return text;
        }
        if (got > 0) {
            text.append(piece.data(), static_cast<std::size_t>(got));
        } else if (errno != EINTR) {
            throw Failure(ExitCode::Usage, "cannot read " + name + ": " + std::strerror(errno));
        }
    }
}

}  // namespace

std::string readCode(const EvalOptions& options) {
    std::string code = options.source;
    std::string where = "the code";
    if (options.fromStandardInput) {
        where = "standard input";
        code = readAll(STDIN_FILENO, where);
    } else if (options.fromFile) {
        where = "'" + options.source + "'";
        const posix::OwnedDescriptor file(::open(options.source.c_str(), O_RDONLY | O_CLOEXEC));
        if (!file) {
            throw Failure(ExitCode::Usage, "cannot open " + where + ": " + std::strerror(errno));
        }
        code = readAll(file.get(), where);
    }
    if (const auto offset = firstInvalidUtf8(code)) {
        throw Failure(ExitCode::Usage, where + " is not valid UTF-8 (at byte " + std::to_string(*offset) +
                                           "); convert it to UTF-8 first");
    }
    return code;
}

ExitCode evaluate(Client& client, const EvalOptions& options, const std::string& code) {
    const std::string name = options.fromFile ? options.source : nameOfCode(code);
    return client
        .request(
            {.iip = client.evaluation(code, options.type, options.sink), .name = name, .sparingly = options.sparingly})
        .exitCode;
}

}  // namespace krutil_client
