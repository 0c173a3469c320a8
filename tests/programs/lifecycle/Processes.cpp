#include "programs/lifecycle/Processes.hpp"

#include <gtest/gtest.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "programs/support/Program.hpp"
#include "support/Eventually.hpp"
#include "support/Patience.hpp"

namespace programs_test {
namespace {

namespace fs = std::filesystem;
using test_support::eventually;
using test_support::patience;

// Names in a directory of /proc that are numbers; what vanishes meanwhile is left out.
std::vector<int> numbersIn(const fs::path& directory) {
    std::vector<int> numbers;
    std::error_code error;
    for (fs::directory_iterator entry(directory, error), end; !error && entry != end; entry.increment(error)) {
        const std::string name = entry->path().filename().string();
        if (std::all_of(name.begin(), name.end(), [](unsigned char c) { return std::isdigit(c) != 0; })) {
            numbers.push_back(std::stoi(name));
        }
    }
    return numbers;
}

// Empty when the process has gone. It may go between open and read, which an iterator over the buffer would throw.
std::string contentOf(const fs::path& file) {
    std::ostringstream content;
    content << std::ifstream(file).rdbuf();
    return content.str();
}

// State and parent of a process or thread; a space and -1 for one that has gone.
struct Status {
    char state = ' ';
    pid_t parent = -1;
};

Status statusOf(const fs::path& directory) {
    const std::string line = contentOf(directory / "stat");
    Status status;
    // The name in parentheses may hold anything.
    if (const auto name = line.rfind(')'); name != std::string::npos) {
        std::istringstream(line.substr(name + 1)) >> status.state >> status.parent;
    }
    return status;
}

fs::path directoryOf(pid_t pid) {
    return fs::path("/proc") / std::to_string(pid);
}

std::string describe(pid_t pid) {
    std::string command = contentOf(directoryOf(pid) / "cmdline");
    std::replace(command.begin(), command.end(), '\0', ' ');
    return std::to_string(pid) + " (" + command + ")";
}

bool isStopped(pid_t pid) {
    const auto threads = numbersIn(directoryOf(pid) / "task");
    return !threads.empty() && std::all_of(threads.begin(), threads.end(), [pid](int thread) {
        return statusOf(directoryOf(pid) / "task" / std::to_string(thread)).state == 'T';
    });
}

}  // namespace

void adoptOrphans() {
    ::prctl(PR_SET_CHILD_SUBREAPER, 1);
}

void expectNoDescendants() {
    // One that ends may leave others, which are children only then.
    for (auto children = childrenOf(::getpid()); !children.empty(); children = childrenOf(::getpid())) {
        for (const pid_t child : children) {
            if (!endsWithin(child, patience)) {
                ADD_FAILURE() << "process " << describe(child) << " is left";
                signalOne(child, SIGKILL);
            }
            ::waitpid(child, nullptr, 0);
        }
    }
}

std::vector<pid_t> childrenOf(pid_t parent) {
    std::vector<pid_t> processes = numbersIn("/proc");
    const auto isOther = [parent](pid_t pid) { return statusOf(directoryOf(pid)).parent != parent; };
    processes.erase(std::remove_if(processes.begin(), processes.end(), isOther), processes.end());
    return processes;
}

pid_t onlyChildOf(pid_t parent) {
    std::vector<pid_t> children;
    if (!eventually([&] { return !(children = childrenOf(parent)).empty(); }) || children.size() != 1) {
        throw std::runtime_error("process " + describe(parent) + " has " + std::to_string(children.size()) +
                                 " children; expected one");
    }
    return children.front();
}

int exitCodeOf(pid_t pid) {
    if (!endsWithin(pid, patience)) {
        ADD_FAILURE() << "process " << describe(pid) << " does not end";
        signalOne(pid, SIGKILL);
    }
    int status = 0;
    // One number less than 1 would wait for another process.
    if (pid <= 1 || ::waitpid(pid, &status, 0) != pid) {
        ADD_FAILURE() << "process " << pid << " is no child of this one";
        return -1;
    }
    return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
}

void stop(pid_t pid) {
    signalOne(pid, SIGSTOP);
    awaitStopped(pid);
}

void awaitStopped(pid_t pid) {
    EXPECT_TRUE(eventually([pid] { return isStopped(pid); })) << "process " << describe(pid) << " does not stop";
}

void resume(pid_t pid) {
    // One that is just ending may search for leaks, for which another process stops its threads: this signal would undo
    // that, and the search would wait for ever.
    if (isStopped(pid)) {
        signalOne(pid, SIGCONT);
    }
}

std::map<int, std::string> descriptorsOf(pid_t pid) {
    std::map<int, std::string> descriptors;
    for (const int number : numbersIn(directoryOf(pid) / "fd")) {
        std::error_code gone;
        descriptors[number] = fs::read_symlink(directoryOf(pid) / "fd" / std::to_string(number), gone).string();
    }
    return descriptors;
}

}  // namespace programs_test
