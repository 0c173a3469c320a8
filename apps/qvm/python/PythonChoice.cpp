#include "qvm/python/PythonChoice.hpp"

#include <patchlevel.h>
#include <unistd.h>

#include <algorithm>
#include <boost/algorithm/string/trim.hpp>
#include <cctype>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string_view>
#include <system_error>

namespace qvm {
namespace {

namespace fs = std::filesystem;

const std::string& embeddedVersion() {
    static const std::string version = std::to_string(PY_MAJOR_VERSION) + "." + std::to_string(PY_MINOR_VERSION);
    return version;
}

// "3.11" of "3.11.2"; empty for a text that is no version.
std::string minorVersion(const std::string& text) {
    const auto first = text.find('.');
    if (first == std::string::npos) {
        return {};
    }
    const auto isDigit = [](unsigned char c) { return std::isdigit(c) != 0; };
    const auto end = std::find_if_not(text.begin() + static_cast<std::ptrdiff_t>(first) + 1, text.end(), isDigit);
    return {text.begin(), end};
}

// What `python3 -m venv` writes as version, and virtualenv as version_info.
std::string versionInFile(const fs::path& file) {
    std::ifstream in(file);
    for (std::string line; std::getline(in, line);) {
        const auto sign = line.find('=');
        if (sign == std::string::npos) {
            continue;
        }
        const std::string key = boost::algorithm::trim_copy(line.substr(0, sign));
        if (key == "version" || key == "version_info") {
            return minorVersion(boost::algorithm::trim_copy(line.substr(sign + 1)));
        }
    }
    return {};
}

struct Version {
    std::string text;  // such as "3.11"; empty where nothing tells
    fs::path told;     // the file that told it, or should have
};

Version versionOf(const fs::path& program) {
    for (const fs::path& directory : {program.parent_path(), program.parent_path().parent_path()}) {
        const fs::path file = directory / "pyvenv.cfg";
        std::error_code error;
        if (fs::is_regular_file(file, error)) {
            return {versionInFile(file), file};
        }
    }
    constexpr std::string_view prefix = "python";
    const fs::path real = fs::canonical(program);
    const std::string name = real.filename().string();
    return {name.starts_with(prefix) ? minorVersion(name.substr(prefix.size())) : std::string(), real};
}

}  // namespace

std::string choosePython(const std::optional<std::string>& asked, const std::string& environment) {
    if (!asked && environment.empty()) {
        return QVM_PYTHON_EXECUTABLE;
    }
    const std::string source = !asked ? "VIRTUAL_ENV names" : "--python names";
    const std::string advice =
        std::string("; choose a Python ") + embeddedVersion() + ", such as --python " + QVM_PYTHON_EXECUTABLE;
    const fs::path named = asked ? fs::path(*asked) : fs::path(environment) / "bin" / "python3";
    // An empty name has no absolute form.
    const fs::path program = named.empty() ? named : fs::absolute(named);
    const auto refuse = [&](const std::string& why) {
        return std::runtime_error(source + " \"" + program.string() + "\", " + why + advice);
    };
    std::error_code error;
    if (!fs::exists(program, error)) {
        throw refuse("which is not there");
    }
    if (!fs::is_regular_file(program, error) || ::access(program.c_str(), X_OK) != 0) {
        throw refuse("which is no program");
    }
    const Version version = versionOf(program);
    if (version.text.empty()) {
        throw refuse("whose version \"" + version.told.string() + "\" does not tell");
    }
    if (version.text != embeddedVersion()) {
        throw refuse("which is Python " + version.text + " (by \"" + version.told.string() +
                     "\"), and this engine runs " + embeddedVersion());
    }
    return program.string();
}

}  // namespace qvm
