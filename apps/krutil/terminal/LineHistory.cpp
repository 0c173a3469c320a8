#include "krutil/terminal/LineHistory.hpp"

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

#include "common/OwnFile.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace krutil_client {
namespace {

namespace posix = foundation::core::posix;

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

// Keeps other programs from the file until the descriptor is closed; none where that cannot be, or Ctrl-C has ended the
// waiting. It is the directory that is locked, because the file is replaced by another one at times.
posix::OwnedDescriptor lock(const std::string& file) {
    const auto directory = std::filesystem::path(file).parent_path();
    posix::OwnedDescriptor locked(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    return locked && ::flock(locked.get(), LOCK_EX) == 0 ? std::move(locked) : posix::OwnedDescriptor();
}

// Why a file that is there is no history of this user; empty when it is one, or none is there.
std::string whyNot(const std::string& file) {
    struct stat status {};
    if (::lstat(file.c_str(), &status) != 0) {
        return {};
    }
    return S_ISREG(status.st_mode) ? apps::objectionTo(status) : "it is no regular file";
}

// None for anything but a file of this user's own.
posix::OwnedDescriptor openFile(const std::string& file, int flags) {
    posix::OwnedDescriptor opened(::open(file.c_str(), flags | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0600));
    struct stat status {};
    const bool usable = opened && ::fstat(opened.get(), &status) == 0 && S_ISREG(status.st_mode) &&
                        apps::objectionTo(status).empty() && ::fchmod(opened.get(), 0600) == 0;
    return usable ? std::move(opened) : posix::OwnedDescriptor();
}

// Writes at the end; the library begins an empty file with its own first line.
bool append(HistoryW* history, posix::OwnedDescriptor file) {
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
    posix::OwnedDescriptor replacement(::mkostemp(name.data(), O_CLOEXEC));
    if (replacement && (!append(history, std::move(replacement)) || ::rename(name.c_str(), file.c_str()) != 0)) {
        ::unlink(name.c_str());
    }
}

}  // namespace

LineHistory::LineHistory(std::string file) : file_(std::move(file)), history_(makeHistory().release()) {
    if (file_.empty()) {
        return;
    }
    if (const std::string why = whyNot(file_); !why.empty()) {
        refusal_ = "the history '" + file_ + "' is not used: " + why + "; move it away, or use --no-history";
    }
    const posix::OwnedDescriptor locked = lock(file_);
    if (locked && openFile(file_, O_RDWR)) {
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
    const auto directory = std::filesystem::path(file_).parent_path();
    if (std::filesystem::create_directories(directory, ignored)) {
        std::filesystem::permissions(directory, std::filesystem::perms::owner_all, ignored);
    }
    const posix::OwnedDescriptor locked = lock(file_);
    posix::OwnedDescriptor opened = locked ? openFile(file_, O_RDWR | O_CREAT) : posix::OwnedDescriptor();
    if (opened) {
        const OwnedHistory only = makeHistory();
        ::history_w(only.get(), &event, H_ENTER, line);
        append(only.get(), std::move(opened));
    }
}

std::optional<LineHistory::Found> LineHistory::find(const std::wstring& part, std::size_t age) const {
    HistEventW event{};
    int more = ::history_w(history_, &event, H_FIRST);
    for (std::size_t i = 0; more >= 0; ++i, more = ::history_w(history_, &event, H_NEXT)) {
        std::wstring text = event.str;
        if (i >= age && text.find(part) != std::wstring::npos) {
            if (text.ends_with(L'\n')) {
                text.pop_back();
            }
            return Found{i, std::move(text)};
        }
    }
    return std::nullopt;
}

std::string defaultHistoryFile() {
    const auto variable = [](const char* name) {
        const char* const value = std::getenv(name);
        return std::string(value != nullptr ? value : "");
    };
    if (const std::string state = variable("XDG_STATE_HOME"); !state.empty() && state[0] == '/') {
        return (std::filesystem::path(state) / "krutil" / "history").string();
    }
    const std::string home = variable("HOME");
    return home.empty() ? std::string() : (std::filesystem::path(home) / ".local/state/krutil/history").string();
}

}  // namespace krutil_client
