#include "krutil/base/JsonLine.hpp"

#include <nlohmann/json.hpp>

#include "krutil/base/Text.hpp"

namespace krutil_client {

std::string jsonLine(const nlohmann::ordered_json& object) {
    // Only strings hold such characters, so that an escape is in its place wherever there is one.
    return safeText(object.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace), Escapes::Json) +
           "\n";
}

}  // namespace krutil_client
