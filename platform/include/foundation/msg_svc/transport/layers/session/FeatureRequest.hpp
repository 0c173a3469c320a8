// One value that a protocol asks a session to negotiate.
#pragma once

#include <string>

namespace foundation::msg_svc::transport::layers::session {

/// What a session does about a feature.
enum class FeatureHandling : int {
    Ignore = 0,    ///< listed for the peer's information; never settled
    Optional = 1,  ///< settled when both peers list a common value, left out otherwise
    Required = 3,  ///< both peers must settle on a common value, or the session is refused
};

/// A (name, value) pair that the protocol can work with. Several requests of one name list its acceptable values, best
/// first.
class FeatureRequest {
  public:
    /// One acceptable `value` of the feature `name`. Both are copied.
    FeatureRequest(const std::string& name, const std::string& value, FeatureHandling handling);

    /// Name of the feature.
    const std::string& name() const noexcept { return name_; }
    /// The value that the protocol can work with.
    const std::string& value() const noexcept { return value_; }
    /// What a session does about it.
    FeatureHandling handling() const noexcept { return handling_; }

    bool operator==(const FeatureRequest&) const = default;  ///< the same in every part

  private:
    std::string name_;
    std::string value_;
    FeatureHandling handling_;
};

}  // namespace foundation::msg_svc::transport::layers::session
