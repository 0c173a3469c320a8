// krutil_bench_engine [QUESTION]: holds the contests of a question, or of all, and prints a line of JSON for each.

#include <CLI/CLI.hpp>
#include <exception>
#include <iostream>
#include <map>
#include <string>

#include "engine/Contest.hpp"
#include "engine/Questions.hpp"
#include "engine/RawPeer.hpp"
#include "engine/SessionPeer.hpp"
#include "peers/RoundTripPeers.hpp"

int main(int argc, char** argv) {
    if (bench::servedPeer(argc, argv)) {
        return 0;
    }
    const std::string first = argc == 2 ? argv[1] : "";
    if (first == bench::rawPeerArgument) {
        bench::serveRaw();
        return 0;
    }
    if (first == bench::sessionPeerArgument) {
        bench::serveSession();
        return 0;
    }
    std::map<std::string, std::function<void(const bench::Effort&)>> questions;
    for (const auto& room : {bench::evaluationQuestions(), bench::arrayQuestions(), bench::messageQuestions()}) {
        for (const bench::Question& question : room) {
            questions[question.name] = question.answer;
        }
    }
    CLI::App app("Times work of a real engine beside its baseline, in turn");
    std::string name;
    bench::Effort effort;
    app.add_option("QUESTION", name, "What to ask (default: everything)")->check(CLI::IsMember(questions));
    app.add_option("--repetitions", effort.repetitions, "How often each contender has its turn")
        ->check(CLI::PositiveNumber)
        ->capture_default_str();
    app.add_option("--batch", effort.batchSeconds, "Seconds of a turn")
        ->check(CLI::PositiveNumber)
        ->capture_default_str();
    app.add_option("--seconds", effort.contestSeconds,
                   "Seconds after which a contest ends, once it has three repetitions")
        ->check(CLI::PositiveNumber)
        ->capture_default_str();
    app.add_option("--largest", effort.largest, "Bytes of the largest array, where sizes are gone through")
        ->transform(CLI::AsSizeValue(false))
        ->capture_default_str();
    app.add_flag("--first-size", effort.firstSizeOnly, "Of questions that go through sizes, only the first one");
    CLI11_PARSE(app, argc, argv);
    try {
        for (const auto& [each, answer] : questions) {
            if (name.empty() || name == each) {
                answer(effort);
            }
        }
    } catch (const std::exception& error) {
        std::cerr << "krutil_bench_engine " << name << ": " << error.what() << '\n';
        return 1;
    }
    return 0;
}
