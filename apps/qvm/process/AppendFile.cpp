#include "qvm/process/AppendFile.hpp"

#include <unistd.h>

#include <cerrno>
#include <new>
#include <system_error>
#include <utility>

#include "common/OwnFile.hpp"

namespace qvm {

AppendFile::AppendFile(const std::string& path, Complain complain) : path_(path), complain_(std::move(complain)) {
    if (path.empty()) {
        return;
    }
    descriptor_ = apps::openOwnFile(path, apps::Begin::AtEnd, "Cannot append to \"" + path + "\"").descriptor;
}

void AppendFile::append(std::string_view text) noexcept {
    if (!descriptor_) {
        return;
    }
    if (gap_ && withinLine_ && write("\n") == 0) {
        lose(text.size());
        return;
    }
    gap_ = false;
    if (const std::size_t written = write(text); written < text.size()) {
        lose(text.size() - written);
    }
}

// Returns how many bytes were written; errno says why not all.
std::size_t AppendFile::write(std::string_view text) noexcept {
    std::size_t written = 0;
    while (written < text.size()) {
        const ssize_t now = ::write(descriptor_.get(), text.data() + written, text.size() - written);
        if (now > 0) {
            written += static_cast<std::size_t>(now);
            withinLine_ = text[written - 1] != '\n';
        } else if (now < 0 && errno != EINTR) {
            break;
        }
    }
    return written;
}

// errno says why.
void AppendFile::lose(std::size_t bytes) noexcept {
    const int reason = errno;
    gap_ = true;
    lost_ += bytes;
    if (told_.exchange(true)) {
        return;
    }
    try {
        complain_("cannot write to '" + path_ + "': " + std::generic_category().message(reason) +
                  "; text for it is lost until there is room");
    } catch (const std::bad_alloc&) {
        // Nothing can be said without memory; the end says how much was lost.
    }
}

bool AppendFile::finish() noexcept {
    const std::size_t lost = lost_;
    if (lost > 0 && !counted_.exchange(true)) {
        try {
            complain_("'" + path_ + "' is not complete: " + std::to_string(lost) +
                      (lost == 1 ? " byte is lost" : " bytes are lost"));
        } catch (const std::bad_alloc&) {
            // As above; the exit code says that something was lost.
        }
    }
    return lost == 0;
}

void AppendFile::startOver() noexcept {
    lost_ = 0;
    told_ = false;
    counted_ = false;
}

}  // namespace qvm
