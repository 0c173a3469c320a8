// A pipe that a test reads what was written to.
#pragma once

#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <string>
#include <system_error>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace test_support {

struct Pipe {
    Pipe() {
        int ends[2];
        if (::pipe2(ends, O_CLOEXEC) != 0) {
            throw std::system_error(errno, std::generic_category(), "pipe2");
        }
        read.reset(ends[0]);
        write.reset(ends[1]);
    }

    /// All that was written, to the end.
    std::string content() {
        write.reset();
        std::string text;
        std::array<char, 4096> piece;
        for (ssize_t got = 0; (got = ::read(read.get(), piece.data(), piece.size())) > 0;) {
            text.append(piece.data(), static_cast<std::size_t>(got));
        }
        return text;
    }

    foundation::core::posix::OwnedDescriptor read;
    foundation::core::posix::OwnedDescriptor write;
};

}  // namespace test_support
