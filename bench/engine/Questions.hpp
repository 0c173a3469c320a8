// What is asked about a real engine, or about two ends without one.
#pragma once

#include <functional>
#include <string>
#include <vector>

#include "engine/Contest.hpp"

namespace bench {

/// A question, by the name that the program is given. Holds its contests one after the other.
struct Question {
    std::string name;
    std::function<void(const Effort&)> answer;
};

/// In no order that matters.
std::vector<Question> evaluationQuestions();
std::vector<Question> arrayQuestions();
std::vector<Question> messageQuestions();

}  // namespace bench
