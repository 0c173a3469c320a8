#include "krutil/terminal/EngineHelp.hpp"

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <utility>

#include "foundation/korveldata/ArrayFactory.hpp"
#include "krutil/base/Text.hpp"
#include "krutil/session/FunctionCall.hpp"
#include "msg_svc/protobuf/ustring.hpp"

namespace krutil_client {
namespace {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using namespace std::chrono_literals;

// A person waits for it with a finger on the key.
constexpr auto patienceForKey = 1s;
// An engine may still be starting Python.
constexpr auto patienceForStart = 10s;

Array textArray(const std::string& text) {
    return ArrayFactory().createText(msg_svc::protobuf::utf8_to_ustring(text));
}

std::optional<std::string> textOf(const Array& array) {
    if (array.elementType() != ElementType::Char16) {
        return std::nullopt;
    }
    return msg_svc::protobuf::ustring_to_utf8(array.toText());
}

std::optional<std::size_t> positionOf(const Array& array) {
    std::int64_t value = -1;
    if (array.elementType() == ElementType::Int64 && array.numberOfElements() == 1) {
        std::memcpy(&value, array.data(), sizeof value);
    }
    return value >= 0 ? std::optional(static_cast<std::size_t>(value)) : std::nullopt;
}

std::vector<std::wstring> linesOf(const std::wstring& text) {
    std::vector<std::wstring> lines;
    for (std::size_t begin = 0; begin < text.size();) {
        const std::size_t end = std::min(text.find(L'\n', begin), text.size());
        lines.push_back(text.substr(begin, end - begin));
        begin = end + 1;
    }
    return lines;
}

}  // namespace

std::optional<Completions> EngineHelp::complete(const std::wstring& text, std::size_t cursor) {
    const auto& requests = client_.requests().unanswered();
    const bool busy = std::any_of(requests.begin(), requests.end(),
                                  [](const auto& request) { return request->state == SentRequest::State::Running; });
    if (!completes_ || busy) {
        return completes_ ? std::optional(Completions{}) : std::nullopt;
    }
    const auto answer = callQuietly(
        client_,
        {"qvm.complete", 3, {textArray(toUtf8(text)), ArrayFactory().createScalar(static_cast<std::int64_t>(cursor))}},
        patienceForKey);
    completes_ = answer.end != QuietAnswer::End::Failed;
    if (answer.end != QuietAnswer::End::Returned) {
        return completes_ ? std::optional(Completions{}) : std::nullopt;
    }
    const auto start = positionOf(answer.outputs[0]);
    const auto end = positionOf(answer.outputs[1]);
    const auto candidates = textOf(answer.outputs[2]);
    if (!start || !end || !candidates || *start > *end || *end > text.size()) {
        completes_ = false;
        return std::nullopt;
    }
    return Completions{*start, *end, linesOf(toWide(*candidates))};
}

std::optional<std::string> EngineHelp::inspect(const std::string& name) {
    const auto cursor = static_cast<std::int64_t>(toWide(name).size());
    const auto answer = callQuietly(client_, {"qvm.inspect", 1, {textArray(name), ArrayFactory().createScalar(cursor)}},
                                    patienceForStart);
    const auto told = answer.end == QuietAnswer::End::Returned ? textOf(answer.outputs[0]) : std::nullopt;
    return told ? std::optional(safeText(*told)) : std::nullopt;
}

std::string EngineHelp::pythonVersion() {
    const auto answer = callQuietly(client_, {"sys.version.__str__", 1, {}}, patienceForStart);
    const auto version = answer.end == QuietAnswer::End::Returned ? textOf(answer.outputs[0]) : std::nullopt;
    return version ? safeText(version->substr(0, version->find(' '))) : std::string();
}

void EngineHelp::shorten(int limit) {
    callQuietly(client_, {"qvm.shorten", 0, {ArrayFactory().createScalar(static_cast<std::int64_t>(limit))}},
                patienceForStart);
}

}  // namespace krutil_client
