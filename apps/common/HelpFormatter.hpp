// The look of --help.
#pragma once

#include <CLI/CLI.hpp>
#include <string>

namespace apps {

/// Lays out help for terminals of 100 columns: names and values in the first column, then the description, with the
/// default value at its end. Subcommands take it over from the command that they are added to afterwards.
class HelpFormatter : public CLI::Formatter {
  public:
    HelpFormatter();
    std::string make_help(const CLI::App* app, std::string name, CLI::AppFormatMode mode) const override;
    std::string make_option_opts(const CLI::Option* option) const override;
    std::string make_option_desc(const CLI::Option* option) const override;
};

/// The name of the value that an option takes, such as FILE; empty for a flag.
std::string valueName(const CLI::Option& option);

}  // namespace apps
