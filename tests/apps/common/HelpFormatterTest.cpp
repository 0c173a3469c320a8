#include "common/HelpFormatter.hpp"

#include <gtest/gtest.h>

namespace apps {
namespace {

TEST(HelpFormatterTest, WrapsDescriptionsAndEndsThemWithTheDefault) {
    CLI::App app("Does things.", "program");
    app.formatter(std::make_shared<HelpFormatter>());
    std::uint64_t size = 0;
    bool flag = false;
    auto* one =
        app.add_option("--size", size,
                       "A description that is long enough to need a second line in the second column of the help")
            ->type_name("SIZE")
            ->default_str("4MiB")
            ->group("Sizes");
    app.add_flag("--flag", flag, "A flag")->excludes(one)->group("Flags");
    EXPECT_EQ(app.help(),
              "Does things.\n"
              "Usage: program [OPTIONS]\n"
              "\n"
              "Options:\n"
              "  -h,--help                     Print this help message and exit\n"
              "\n"
              "Sizes:\n"
              "  --size SIZE                   A description that is long enough to need a second line in the\n"
              "                                second column of the help (default: 4MiB)\n"
              "\n"
              "Flags:\n"
              "  --flag                        A flag\n"
              "\n");
}

}  // namespace
}  // namespace apps
