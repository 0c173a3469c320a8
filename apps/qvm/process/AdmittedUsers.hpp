// Whose connections an engine accepts.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace qvm {

/// The user of this process, and those who are named: a proxy, say, that runs as a user of its own. Whoever is admitted
/// can have code run as this user.
class AdmittedUsers {
  public:
    /// `names` are those of accounts. Throws std::runtime_error for one that there is not.
    explicit AdmittedUsers(const std::vector<std::string>& names);

    /// Why whoever connected this Unix socket is refused, to follow "refused a client"; empty for who is admitted.
    std::string refusal(int connection) const;

    /// Whether there are others than this process's own.
    bool areSeveral() const noexcept { return users_.size() > 1; }

  private:
    std::vector<uid_t> users_;
};

}  // namespace qvm
