#include "krutil/inspect/InspectCommand.hpp"

#include <algorithm>
#include <cmath>
#include <limits>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <system_error>
#include <utility>
#include <vector>

#include "common/RecordingReader.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/JsonLine.hpp"
#include "krutil/base/Output.hpp"
#include "krutil/base/Text.hpp"
#include "krutil/inspect/InspectedMessage.hpp"
#include "krutil/inspect/Lint.hpp"
#include "krutil/inspect/MessagePage.hpp"
#include "krutil/inspect/MessageText.hpp"
#include "krutil/inspect/NewFile.hpp"
#include "krutil/inspect/Summary.hpp"
#include "krutil/inspect/Timelines.hpp"

namespace krutil_client {
namespace {

// Of a unit, unless all its bytes are asked for. Decoding a message takes several times its size.
constexpr std::uint64_t keptBytes = 1U << 20U;

// The filters as they are typed; empty for none.
std::string filtersOf(const InspectOptions& options) {
    std::string text;
    const auto add = [&text](const char* option, const std::string& value) {
        text += (text.empty() ? "" : " ") + std::string(option) + " " + value;
    };
    if (!options.request.empty()) {
        add("--request", options.request);
    }
    for (const std::string& type : options.types) {
        add("--type", type);
    }
    if (options.from) {
        add("--from", *options.from == InspectOptions::Role::Client ? "client" : "engine");
    }
    if (options.since > 0) {
        add("--since", lineText(options.since));
    }
    if (std::isfinite(options.until)) {
        add("--until", lineText(options.until));
    }
    return text;
}

class Inspection {
  public:
    Inspection(const InspectOptions& options, Output& out, Output& err, Interrupt& interrupt)
        : options_(options),
          out_(out),
          err_(err),
          reader_(
              options.file, [&interrupt](int fd) { interrupt.waitForInput(fd); },
              options.hex || options.lint ? std::numeric_limits<std::uint64_t>::max() : keptBytes),
          messages_(options.hex) {}

    ExitCode run() {
        try {
            while (auto unit = reader_.next()) {
                show(std::move(*unit));
            }
        } catch (const apps::RecordingError& error) {
            writePage("This page has what the recording says before it is damaged: " + std::string(error.what()));
            throw;
        }
        for (const InspectedMessage& message : messages_.rest()) {
            show(message);
        }
        out_.write(timelines_.rest());
        const auto sentence = reader_.unfinished();
        if (sentence) {
            say("unfinished", *sentence);
        }
        writePage(sentence ? "This page has what is there: " + *sentence + "." : "");
        if (options_.lint && !options_.json && findings_ == 0) {
            out_.write("no rule is broken in " + std::to_string(units_) + " units of " +
                       std::to_string(reader_.sessions().size()) + " sessions\n");
        }
        return findings_ == 0 ? ExitCode::Ok : ExitCode::Violation;
    }

  private:
    void say(const char* event, const std::string& sentence) {
        if (options_.json) {
            out_.write(jsonLine({{"event", event}, {"text", sentence}}));
        } else {
            err_.write("krutil: " + sentence + "\n");
        }
    }

    void showSessions() {
        for (; shownSessions_ < reader_.sessions().size(); ++shownSessions_) {
            const apps::RecordedSession& session = reader_.sessions()[shownSessions_];
            if (options_.json) {
                out_.write(jsonLine({{"event", "session"},
                                     {"session", shownSessions_},
                                     {"process", session.process},
                                     {"program", session.program},
                                     {"begin", *begin_}}));
            } else if (!options_.lint && !options_.timeline && !options_.html) {
                out_.write("session " + std::to_string(shownSessions_) + ", recorded by " +
                           quotedText(session.process, 40) + ", " + quotedText(session.program, 80) + "\n");
            }
        }
    }

    void show(apps::RecordedUnit unit) {
        begin_ = begin_.value_or(unit.nanoseconds);
        ++units_;
        showSessions();
        if (!options_.lint) {
            if (const auto message = messages_.take(std::move(unit))) {
                show(*message);
            }
            return;
        }
        const auto fault = lint_.take(unit, reader_.sessions()[unit.session]);
        if (!fault) {
            return;
        }
        ++findings_;
        if (options_.json) {
            out_.write(
                jsonLine({{"event", "finding"}, {"session", unit.session}, {"offset", unit.offset}, {"text", *fault}}));
        } else {
            out_.write(reader_.name() + ", byte " + std::to_string(unit.offset) + ": " + *fault + "\n");
        }
    }

    // If there is to be one. Errors of the file itself are `note`; empty for none.
    void writePage(const std::string& note) {
        if (!options_.html) {
            return;
        }
        std::vector<std::string> notes;
        if (!note.empty()) {
            notes.push_back(note);
        }
        if (const std::string filters = filtersOf(options_); !filters.empty()) {
            notes.push_back(std::to_string(unwanted_) + (unwanted_ == 1 ? " message is" : " messages are") +
                            " left out by " + filters + ".");
        }
        const std::string page = page_.html(reader_.sessions(), options_.file, std::move(notes));
        if (*options_.html == "-") {
            out_.write(page);
        } else {
            NewFile file(*options_.html);
            file.write(page);
            file.keep();
        }
    }

    void show(const InspectedMessage& message) {
        const bool wanted = isWanted(message);
        unwanted_ += wanted ? 0U : 1U;
        if (options_.html) {
            page_.take(message, *begin_, wanted);
            return;
        }
        if (!wanted) {
            return;
        }
        if (options_.timeline) {
            out_.write(timelines_.take(message));
        } else {
            out_.write(options_.json ? messageJson(message, *begin_, options_)
                                     : messageText(message, *begin_, options_));
        }
    }

    bool isWanted(const InspectedMessage& message) const {
        const std::uint64_t time = std::max(message.first().nanoseconds, *begin_);
        const double seconds = static_cast<double>(time - *begin_) / 1e9;
        const auto wants = [&message](const std::string& type) { return type == message.type(); };
        return message.request.starts_with(options_.request) &&
               (options_.types.empty() || std::any_of(options_.types.begin(), options_.types.end(), wants)) &&
               (!options_.from || *options_.from == message.first().sender) && seconds >= options_.since &&
               seconds <= options_.until;
    }

    const InspectOptions& options_;
    Output& out_;
    Output& err_;
    apps::RecordingReader reader_;
    MessageAssembler messages_;
    Timelines timelines_;
    MessagePage page_;
    Lint lint_;
    std::optional<std::uint64_t> begin_;  ///< time of the first packet
    std::size_t shownSessions_ = 0;
    std::uint64_t units_ = 0;
    std::uint64_t findings_ = 0;
    std::uint64_t unwanted_ = 0;
};

}  // namespace

ExitCode inspectRecording(const InspectOptions& options, Output& out, Output& err, Interrupt& interrupt) {
    try {
        return Inspection(options, out, err, interrupt).run();
    } catch (const apps::RecordingError& error) {
        throw Failure(ExitCode::Usage, error.what());
    } catch (const std::system_error& error) {
        throw Failure(ExitCode::Usage, error.what());
    }
}

}  // namespace krutil_client
