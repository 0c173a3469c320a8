#include "common/Build.hpp"

namespace apps {
namespace {

#define KRUTIL_TEXT_OF(x) #x
#define KRUTIL_TEXT(x) KRUTIL_TEXT_OF(x)
#if defined(__clang__)
constexpr std::string_view compiler =
    "Clang " KRUTIL_TEXT(__clang_major__) "." KRUTIL_TEXT(__clang_minor__) "." KRUTIL_TEXT(__clang_patchlevel__);
#elif defined(__GNUC__)
constexpr std::string_view compiler =
    "GCC " KRUTIL_TEXT(__GNUC__) "." KRUTIL_TEXT(__GNUC_MINOR__) "." KRUTIL_TEXT(__GNUC_PATCHLEVEL__);
#else
constexpr std::string_view compiler = "unknown compiler";
#endif
#undef KRUTIL_TEXT
#undef KRUTIL_TEXT_OF

}  // namespace

std::string buildString(std::string_view program) {
    std::string text(program);
    text += " " KRUTIL_VERSION " (krutil_protobuf, ";
    text += compiler;
    text += ")";
    return text;
}

}  // namespace apps
