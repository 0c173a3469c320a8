#include "krutil/terminal/Asides.hpp"

#include <algorithm>
#include <cctype>
#include <nlohmann/json.hpp>

namespace krutil_client {
namespace {

constexpr const char* blanksAround = " \t";

std::string trimmed(const std::string& text, const std::string& ends) {
    const auto first = text.find_first_not_of(ends);
    return first == std::string::npos ? std::string() : text.substr(first, text.find_last_not_of(ends) + 1 - first);
}

// As far as it matters: code with a question mark at its end is an error of the code.
bool isName(const std::string& text) {
    return !text.empty() && std::all_of(text.begin(), text.end(), [](char c) {
        const auto byte = static_cast<unsigned char>(c);
        return std::isalnum(byte) != 0 || c == '_' || c == '.' || byte >= 0x80U;
    });
}

}  // namespace

bool answerAside(const std::string& line, const Inspect& inspect, Output& out) {
    const std::string text = trimmed(line, blanksAround);
    if (text.starts_with('!')) {
        const auto command = nlohmann::json(trimmed(text.substr(1), blanksAround)).dump();
        out.write("Lines are Python. This runs a command where the engine is:\n    import subprocess; subprocess.run(" +
                  command + ", shell=True)\n");
        return true;
    }
    const std::string name = trimmed(text, " \t?");
    if (!text.starts_with('?') && !(text.ends_with('?') && isName(name))) {
        return false;
    }
    if (!isName(name)) {
        out.write("?NAME tells about a name, for example ?print or ?str.join.\n");
        return true;
    }
    const auto told = inspect(name);
    if (!told) {
        out.write("The engine cannot tell about names.\n");
    } else if (told->empty()) {
        out.write("There is nothing to tell about '" + name + "'.\n");
    } else {
        out.write(told->ends_with('\n') ? *told : *told + "\n");
    }
    return true;
}

}  // namespace krutil_client
