#include "krutil/commands/EvalCommand.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

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

// A request of its own before the code, which may begin with statements that must be its first.
std::string argumentsCode(const EvalOptions& options) {
    nlohmann::json list = nlohmann::json::array({options.source});
    for (const std::string& argument : *options.arguments) {
        list.push_back(argument);
    }
    // JSON's texts are literals of Python too.
    return "__import__('sys').argv = " + list.dump();
}

ExitCode submit(Client& client, const EvalOptions& options, const std::string& code, const std::string& name) {
    return client
        .request(
            {.iip = client.evaluation(code, options.type, options.sink), .name = name, .sparingly = options.sparingly})
        .exitCode;
}

}  // namespace

std::string readCode(const EvalOptions& options) {
    for (const std::string& argument : options.arguments.value_or(std::vector<std::string>())) {
        if (firstInvalidUtf8(argument)) {
            throw Failure(ExitCode::Usage, "an argument of the script is not valid UTF-8");
        }
    }
    if (options.fromFile && options.arguments && firstInvalidUtf8(options.source)) {
        throw Failure(ExitCode::Usage, "the file's name is not valid UTF-8");
    }
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
    if (options.arguments) {
        // Only the code itself is timed.
        const bool timing = client.timing();
        client.setTiming(false);
        if (const ExitCode result = submit(client, options, argumentsCode(options), ""); result != ExitCode::Ok) {
            return result;
        }
        client.setTiming(timing);
    }
    return submit(client, options, code,
                  options.fromFile ? std::filesystem::absolute(options.source).string() : nameOfCode(code));
}

}  // namespace krutil_client
