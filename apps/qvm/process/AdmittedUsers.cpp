#include "qvm/process/AdmittedUsers.hpp"

#include <pwd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <stdexcept>
#include <system_error>

namespace qvm {

AdmittedUsers::AdmittedUsers(const std::vector<std::string>& names) : users_{::geteuid()} {
    for (const std::string& name : names) {
        const passwd* const account = ::getpwnam(name.c_str());
        if (account == nullptr) {
            throw std::runtime_error("--allow-user: there is no user \"" + name + "\" on this machine.");
        }
        users_.push_back(account->pw_uid);
    }
}

std::string AdmittedUsers::refusal(int connection) const {
    ucred peer{};
    socklen_t length = sizeof(peer);
    if (::getsockopt(connection, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) {
        return " whose user the system does not tell: " + std::generic_category().message(errno);
    }
    if (std::find(users_.begin(), users_.end(), peer.uid) != users_.end()) {
        return {};
    }
    std::string list;
    for (const uid_t user : users_) {
        list += (list.empty() ? "" : ", ") + std::to_string(user);
    }
    return " of user " + std::to_string(peer.uid) + ", since this engine serves user" + (areSeveral() ? "s " : " ") +
           list + " only";
}

}  // namespace qvm
