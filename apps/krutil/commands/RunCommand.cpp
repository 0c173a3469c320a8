#include "krutil/commands/RunCommand.hpp"

#include <nlohmann/json.hpp>

#include "krutil/base/Text.hpp"
#include "krutil/commands/EvalCommand.hpp"

namespace krutil_client {
namespace {

// A request of its own before the script, which may begin with statements that must be its first.
std::string argumentsCode(const RunOptions& options) {
    nlohmann::json list = nlohmann::json::array({options.file});
    for (const std::string& argument : options.arguments) {
        list.push_back(argument);
    }
    // JSON's texts are literals of Python too.
    return "__import__('sys').argv = " + list.dump();
}

EvalOptions evalOptions(const RunOptions& options) {
    EvalOptions eval;
    eval.source = options.file;
    eval.fromFile = true;
    eval.type = cmddistributor::CodeType::ScriptType;
    eval.sparingly = options.sparingly;
    eval.sink = options.sink;
    return eval;
}

}  // namespace

std::string readScript(const RunOptions& options) {
    for (const std::string& argument : options.arguments) {
        if (firstInvalidUtf8(argument)) {
            throw Failure(ExitCode::Usage, "an argument of the script is not valid UTF-8");
        }
    }
    if (firstInvalidUtf8(options.file)) {
        throw Failure(ExitCode::Usage, "the file's name is not valid UTF-8");
    }
    return readCode(evalOptions(options));
}

ExitCode runScript(Client& client, const RunOptions& options, const std::string& text) {
    // Only the script itself is timed.
    const bool timing = client.timing();
    client.setTiming(false);
    if (const ExitCode result = evaluate(client, evalOptions(options), argumentsCode(options));
        result != ExitCode::Ok) {
        return result;
    }
    client.setTiming(timing);
    return evaluate(client, evalOptions(options), text);
}

}  // namespace krutil_client
