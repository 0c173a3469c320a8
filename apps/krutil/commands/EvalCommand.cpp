#include "krutil/commands/EvalCommand.hpp"

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <boost/make_shared.hpp>
#include <cerrno>
#include <cstring>
#include <string>
#include <string_view>

#include "cmddistributor/EvalIIP.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "krutil/base/Text.hpp"
#include "msg_svc/protobuf/ustring.hpp"

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

// What a list of requests shows: the file's name, or the beginning of the code's first line.
std::string displayName(const EvalOptions& options, const std::string& code) {
    if (options.fromFile) {
        return options.source;
    }
    constexpr std::size_t longest = 60;
    std::string name = code.substr(0, code.find('\n'));
    if (name.size() > longest) {
        name.resize(longest);
        while (firstInvalidUtf8(name)) {
            name.pop_back();
        }
        name += "...";
    }
    return name;
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
    const auto iip = boost::make_shared<const cmddistributor::EvalIIP>(
        "python", cmddistributor::IqmStreamID::ekIqmCmdWinStream, nullptr, client.outTraits(options.sink),
        client.errTraits(options.sink), msg_svc::protobuf::utf8_to_ustring(code), options.type);
    const auto when = krutil::cmddistributor::WhenToDequeue::DEQUEUE_AT_IDLE;
    return client.request(iip, when, displayName(options, code), options.sparingly).exitCode;
}

}  // namespace krutil_client
