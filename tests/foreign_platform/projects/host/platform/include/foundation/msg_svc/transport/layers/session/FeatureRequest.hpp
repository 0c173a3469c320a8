// What a protocol asks a session to settle.
#pragma once

#include <string>

namespace foundation::msg_svc::transport::layers::session {

enum class FeatureHandling : unsigned short { ifPossible = 2, always = 3 };

struct FeatureRequest {
    std::string feature;
    std::string choice;
    FeatureHandling handling;
};

}  // namespace foundation::msg_svc::transport::layers::session
