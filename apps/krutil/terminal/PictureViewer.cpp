#include "krutil/terminal/PictureViewer.hpp"

#include <chrono>
#include <exception>
#include <stdexcept>
#include <utility>

#include "krutil/session/FunctionCall.hpp"

namespace krutil_client {
namespace {

using namespace std::chrono_literals;

// Pictures may be large, and the way long.
constexpr auto patienceForPictures = 60s;
// A terminal may be at the far end of a slow line.
constexpr auto patienceForTerminal = 3s;

std::vector<Picture> takePictures(Client& client) {
    const QuietAnswer answer = callQuietly(client, {"qvm.take_displays", 2}, patienceForPictures);
    switch (answer.end) {
        case QuietAnswer::End::Returned:
            return picturesOf(answer.outputs);
        case QuietAnswer::End::Late:
            throw std::runtime_error("the engine has not answered");
        case QuietAnswer::End::Failed:
            break;
    }
    throw std::runtime_error("the engine cannot hand them over");
}

}  // namespace

PictureViewer::PictureViewer(Client& client, Printer& printer, Output& out, Way way,
                             std::function<void(const std::string& text)> typed)
    : client_(client), printer_(printer), out_(out), way_(way), typed_(std::move(typed)) {
    client_.setShowPictures([this] { showAll(); });
}

PictureViewer::~PictureViewer() {
    client_.setShowPictures(nullptr);
}

void PictureViewer::showAll() {
    // Ctrl-C is for the engine that is waited for, not for the program.
    const Canceller canceller = client_.cancelling({});
    try {
        for (const Picture& picture : takePictures(client_)) {
            show(picture);
        }
    } catch (const Failure&) {
        throw;
    } catch (const std::runtime_error& error) {
        client_.say(std::string("pictures cannot be shown: ") + error.what());
    }
}

void PictureViewer::show(const Picture& picture) {
    for (const PictureForm& form : picture.forms) {
        if (way_ != Way::AllToFiles && form.type == PictureForm::Type::Html) {
            // The person has the value's text.
            continue;
        }
        if (!draw(form)) {
            printer_.pictured({picture, form, writePicture(form)});
        }
        if (way_ != Way::AllToFiles) {
            // The best form is the first one.
            return;
        }
    }
}

bool PictureViewer::draw(const PictureForm& form) {
    if (way_ != Way::Drawn || form.type != PictureForm::Type::Png) {
        return false;
    }
    if (!protocol_) {
        if (const auto asked = askTerminal(out_, patienceForTerminal)) {
            protocol_ = asked->protocol;
            typed_(asked->typed);
        }
    }
    const auto drawn =
        drawing(protocol_.value_or(ImageProtocol::None), form.content, sizeOfPng(form.content).width, out_);
    if (drawn) {
        out_.write(*drawn);
    }
    return drawn.has_value();
}

}  // namespace krutil_client
