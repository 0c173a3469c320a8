#include "common/HelpFormatter.hpp"

#include <sstream>

namespace apps {
namespace {

constexpr std::size_t firstColumn = 32;
constexpr std::size_t columns = 100;

std::string wrapped(const std::string& text) {
    std::istringstream words(text);
    std::string result;
    std::string word;
    std::size_t used = 0;
    while (words >> word) {
        if (used != 0 && used + 1 + word.size() > columns - firstColumn) {
            result += '\n';
            used = 0;
        }
        if (used != 0) {
            result += ' ';
            ++used;
        }
        result += word;
        used += word.size();
    }
    return result;
}

}  // namespace

std::string valueName(const CLI::Option& option) {
    if (option.get_type_size() == 0) {
        return {};
    }
    // Checks add what they accept to the name of the type, behind a colon.
    const std::string type = option.get_type_name();
    return type.substr(0, type.find(':'));
}

HelpFormatter::HelpFormatter() {
    column_width(firstColumn);
}

std::string HelpFormatter::make_help(const CLI::App* app, std::string name, CLI::AppFormatMode mode) const {
    std::string help = CLI::Formatter::make_help(app, std::move(name), mode);
    for (auto gap = help.find("\n\n\n"); gap != std::string::npos; gap = help.find("\n\n\n", gap)) {
        help.erase(gap, 1);
    }
    return help;
}

std::string HelpFormatter::make_option_opts(const CLI::Option* option) const {
    const std::string name = valueName(*option);
    return name.empty() ? std::string() : " " + name;
}

std::string HelpFormatter::make_option_desc(const CLI::Option* option) const {
    const std::string value = option->get_default_str();
    return wrapped(option->get_description() + (value.empty() ? "" : " (default: " + value + ")"));
}

}  // namespace apps
