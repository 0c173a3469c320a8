#include "LineHistory.hpp"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <utility>

#include "Descriptor.hpp"

namespace client {
namespace {

struct EndHistory {
    void operator()(HistoryW* history) const noexcept { ::history_wend(history); }
};
using OwnedHistory = std::unique_ptr<HistoryW, EndHistory>;

OwnedHistory makeHistory() {
    OwnedHistory history(::history_winit());
    if (!history) {
        throw std::runtime_error("no memory for a history");
    }
    HistEventW event{};
    ::history_w(history.get(), &event, H_SETSIZE, LineHistory::lines);
    ::history_w(history.get(), &event, H_SETUNIQUE, 1);
    return history;
}

// Opens the file for this program alone until the descriptor is closed; none where that cannot be. Ctrl-C ends waiting.
Descriptor openLocked(const std::string& file, int flags) {
    // One who replaces the file while this one waits leaves it with a lock on the old one. Nobody does so again and
    // again: that is done at the start only.
    for (int attempt = 0; attempt < 10; ++attempt) {
        Descriptor opened(::open(file.c_str(), flags | O_CLOEXEC | O_NOFOLLOW, 0600));
        struct stat here {};
        struct stat there {};
        if (!opened || ::flock(opened.get(), LOCK_EX) != 0 || ::fstat(opened.get(), &here) != 0 ||
            !S_ISREG(here.st_mode)) {
            return Descriptor();
        }
        if (::stat(file.c_str(), &there) == 0 && here.st_dev == there.st_dev && here.st_ino == there.st_ino) {
            return ::fchmod(opened.get(), 0600) == 0 ? std::move(opened) : Descriptor();
        }
    }
    return Descriptor();
}

// Writes at the end; the library begins an empty file with its own first line.
bool append(HistoryW* history, Descriptor file) {
    const std::unique_ptr<FILE, int (*)(FILE*)> stream(::fdopen(file.get(), "a"), &std::fclose);
    if (!stream) {
        return false;
    }
    file.release();
    HistEventW event{};
    return std::fseek(stream.get(), 0, SEEK_END) == 0 && ::history_w(history, &event, H_SAVE_FP, stream.get()) >= 0 &&
           std::fflush(stream.get()) == 0;
}

// Leaves the newest lines only.
void cut(HistoryW* history, const std::string& file) {
    std::string name = file + ".XXXXXX";
    Descriptor replacement(::mkostemp(name.data(), O_CLOEXEC));
    if (replacement && (!append(history, std::move(replacement)) || ::rename(name.c_str(), file.c_str()) != 0)) {
        ::unlink(name.c_str());
    }
}

}  // namespace

LineHistory::LineHistory(std::string file) : file_(std::move(file)), history_(makeHistory().release()) {
    if (file_.empty()) {
        return;
    }
    if (const Descriptor locked = openLocked(file_, O_RDWR)) {
        HistEventW event{};
        ::history_w(history_, &event, H_LOAD, file_.c_str());
        if (::history_w(history_, &event, H_GETSIZE) >= 0 && event.num >= lines) {
            cut(history_, file_);
        }
    }
}

LineHistory::~LineHistory() {
    ::history_wend(history_);
}

void LineHistory::add(const wchar_t* line) {
    HistEventW event{};
    ::history_w(history_, &event, H_ENTER, line);
    if (file_.empty()) {
        return;
    }
    std::error_code ignored;
    std::filesystem::create_directories(std::filesystem::path(file_).parent_path(), ignored);
    if (Descriptor locked = openLocked(file_, O_RDWR | O_CREAT | O_APPEND)) {
        const OwnedHistory only = makeHistory();
        ::history_w(only.get(), &event, H_ENTER, line);
        append(only.get(), std::move(locked));
    }
}

}  // namespace client
