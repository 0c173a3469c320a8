#include "common/RecordOptions.hpp"

#include "common/LimitOptions.hpp"

namespace apps {

void addRecordOptions(CLI::App& app, RecordOptions& options, const std::string& group, const std::string& fileText) {
    CLI::Option* const file = app.add_option("--record", options.file, fileText)->type_name("FILE")->group(group);
    addSizeOption(app, "--record-snap", options.snap, "Record only the first bytes of each frame, its header at least")
        ->default_str("")
        ->needs(file)
        ->group(group);
    addSizeOption(
        app, "--record-size", options.size,
        "Bound the file: rename it to FILE.1 when it would become larger, in the place of an earlier one, and "
        "begin another; 1MiB or more",
        std::numeric_limits<std::uint64_t>::max(), RecordOptions::smallestSize)
        ->default_str("")
        ->needs(file)
        ->group(group);
}

}  // namespace apps
