#include "qvm/process/SessionGroups.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <fstream>
#include <iterator>
#include <sstream>
#include <stdexcept>
#include <string_view>
#include <system_error>

#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/core/posix/writeFully.hpp"

namespace qvm {
namespace {

namespace posix = foundation::core::posix;

// To a file such as cgroup.procs, this is the process that writes it.
constexpr std::string_view thisProcess = "0";

[[noreturn]] void failToDivide(const std::string& why) {
    throw std::runtime_error(
        why +
        ". --limit-processes needs a control group (version 2) that is delegated to the engine, and in which there is "
        "no other process: put \"Delegate=pids\" and \"ProtectControlGroups=no\" into the unit of its service, "
        "or start it with \"systemd-run --user --scope -p Delegate=yes krutil-qvm ...\".");
}

std::ifstream openForReading(const std::string& path) {
    std::ifstream in(path);
    if (!in) {
        failToDivide("Cannot read \"" + path + "\": " + std::generic_category().message(errno));
    }
    return in;
}

std::string pathOfGroup(const std::string& file) {
    std::ifstream in = openForReading(file);
    for (std::string line; std::getline(in, line);) {
        if (line.rfind("0::/", 0) == 0) {
            return line.substr(3);
        }
    }
    failToDivide("\"" + file + "\" has no line that begins with \"0::/\", the group of version 2");
}

// Where the group is to be found: a mount may show a part of the groups only.
std::string directoryOfGroup(const std::string& file, const std::string& group) {
    std::ifstream in = openForReading(file);
    for (std::string line; std::getline(in, line);) {
        std::istringstream fields(line);
        std::string skipped;
        std::string root;
        std::string where;
        fields >> skipped >> skipped >> skipped >> root >> where;
        const std::string below = root == "/" ? std::string() : root;
        const bool shown = group.rfind(below + "/", 0) == 0 || group == below;
        if (line.find(" - cgroup2 ") != std::string::npos && shown) {
            return where + group.substr(below.size());
        }
    }
    failToDivide("\"" + file + "\" has no mount of the type \"cgroup2\" that shows the group \"" + group + "\"");
}

// The line that lists some.
std::string controllersIn(const std::string& file) {
    std::ifstream in = openForReading(file);
    std::string all;
    std::getline(in, all);
    return all;
}

bool hasPids(const std::string& controllers) {
    return (" " + controllers + " ").find(" pids ") != std::string::npos;
}

// errno says why not.
bool makeGroup(const std::string& group) noexcept {
    return ::mkdir(group.c_str(), 0755) == 0 || errno == EEXIST;
}

// errno says why not. The system takes what is written as a whole.
bool writeTo(const std::string& file, std::string_view text) noexcept {
    const posix::OwnedDescriptor descriptor(::open(file.c_str(), O_WRONLY | O_CLOEXEC));
    return descriptor && posix::writeFully(descriptor.get(), text);
}

}  // namespace

SessionGroups::SessionGroups(std::uint64_t limit, const std::string& self) : limit_(limit), owner_(::getpid()) {
    top_ = directoryOfGroup(self + "/mountinfo", pathOfGroup(self + "/cgroup"));
    const std::string own = top_ + "/krutil-listener";
    const std::string available = top_ + "/cgroup.controllers";
    const std::string division = top_ + "/cgroup.subtree_control";
    if (const std::string all = controllersIn(available); !hasPids(all)) {
        failToDivide("\"" + available + "\" has \"" + all + "\", and not \"pids\"");
    }
    // What is enabled here is disabled at the end, so it must not be somebody else's.
    if (hasPids(controllersIn(division))) {
        failToDivide(
            "\"" + division +
            "\" has \"pids\" already: the group is not for this engine alone, or another one was killed in it");
    }
    const auto expect = [](bool done, const std::string& what) {
        if (!done) {
            failToDivide("Cannot " + what + ": " + std::generic_category().message(errno));
        }
    };
    try {
        expect(makeGroup(own) && writeTo(own + "/cgroup.procs", thisProcess),
               "move the listener into the group \"" + own + "\"");
        expect(writeTo(division, "+pids"), "write \"+pids\" to \"" + division + "\"");
    } catch (...) {
        giveBack();
        throw;
    }
}

SessionGroups::~SessionGroups() {
    if (::getpid() == owner_) {
        giveBack();
    }
}

void SessionGroups::join() const {
    const std::string group = groupOf(::getpid());
    // A group of this name has what a process of the same number left behind; that counts as well.
    if (!makeGroup(group) || !writeTo(group + "/pids.max", std::to_string(limit_)) ||
        !writeTo(group + "/cgroup.procs", thisProcess)) {
        throw std::system_error(errno, std::generic_category(),
                                "Cannot limit the processes of the session in \"" + group + "\"");
    }
}

void SessionGroups::ended(pid_t process) {
    groups_[process] = true;
    remove(false);
}

std::string SessionGroups::groupOf(pid_t process) const {
    return top_ + "/krutil-session-" + std::to_string(process);
}

// The system refuses to remove a group that has processes.
void SessionGroups::remove(bool all) noexcept {
    for (auto each = groups_.begin(); each != groups_.end();) {
        const bool gone = (all || each->second) && (::rmdir(groupOf(each->first).c_str()) == 0 || errno == ENOENT);
        each = gone ? groups_.erase(each) : std::next(each);
    }
}

// With "-pids", groups that are left would be bounded no more.
void SessionGroups::giveBack() noexcept {
    remove(true);
    if (groups_.empty()) {
        writeTo(top_ + "/cgroup.subtree_control", "-pids");
        writeTo(top_ + "/cgroup.procs", thisProcess);
        ::rmdir((top_ + "/krutil-listener").c_str());
    }
}

}  // namespace qvm
