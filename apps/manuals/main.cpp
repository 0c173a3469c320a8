// Prints the commands and options of both programs as one JSON object, from the tables by which the programs read their
// command lines. make.py makes manual pages and completions of it.
#include <CLI/CLI.hpp>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <iostream>
#include <nlohmann/json.hpp>
#include <string>

#include "common/HelpFormatter.hpp"
#include "krutil/commands/CommandLine.hpp"
#include "qvm/Options.hpp"

namespace {

using nlohmann::ordered_json;

// The words of which the value must be one; empty when it may be another.
ordered_json choicesOf(const CLI::Option& option) {
    // The check names them in braces: "TYPE:{block,script}".
    const std::string type = option.get_type_name();
    const auto open = type.find('{');
    ordered_json choices = ordered_json::array();
    if (open != std::string::npos) {
        for (const std::string& word : CLI::detail::split(type.substr(open + 1, type.rfind('}') - open - 1), ',')) {
            choices.push_back(word);
        }
    }
    return choices;
}

ordered_json namesOf(const CLI::Option& option) {
    ordered_json names = ordered_json::array();
    for (const std::string& name : option.get_snames()) {
        names.push_back("-" + name);
    }
    for (const std::string& name : option.get_lnames()) {
        names.push_back("--" + name);
    }
    return names;
}

ordered_json commandOf(const CLI::App& app) {
    ordered_json positionals = ordered_json::array();
    ordered_json options = ordered_json::array();
    for (const CLI::Option* option : app.get_options()) {
        if (option->get_group().empty()) {
            continue;  // hidden
        }
        if (option->get_positional()) {
            positionals.push_back({{"name", option->get_name(true)},
                                   {"description", option->get_description()},
                                   {"required", option->get_required()},
                                   {"repeated", option->get_items_expected_max() > 1}});
        } else {
            options.push_back({{"names", namesOf(*option)},
                               {"value", apps::valueName(*option)},
                               {"choices", choicesOf(*option)},
                               {"default", option->get_default_str()},
                               {"group", option->get_group()},
                               {"description", option->get_description()}});
        }
    }
    ordered_json commands = ordered_json::array();
    for (const CLI::App* command : app.get_subcommands({})) {
        commands.push_back(commandOf(*command));
    }
    return {{"name", app.get_name()},        {"description", app.get_description()},
            {"footer", app.get_footer()},    {"positionals", std::move(positionals)},
            {"options", std::move(options)}, {"commands", std::move(commands)}};
}

}  // namespace

int main() {
    try {
        ordered_json programs = ordered_json::array();
        const auto add = [&programs](const CLI::App& app) { programs.push_back(commandOf(app)); };
        krutil_client::describeCommandLine(add);
        qvm::describeCommandLine(add);
        std::cout << programs.dump(1) << std::endl;
        return std::cout ? EXIT_SUCCESS : EXIT_FAILURE;
    } catch (const std::exception& error) {
        std::fprintf(stderr, "krutil_option_tables: %s\n", error.what());
        return EXIT_FAILURE;
    }
}
