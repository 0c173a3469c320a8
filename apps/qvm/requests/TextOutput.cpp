#include "qvm/requests/TextOutput.hpp"

#include <utility>

#include "cmddistributor/IqmStreamID.hpp"

namespace qvm {
namespace {

using cmddistributor::IqmStreamID;
using krutil::io::StreamTypeEnum;

bool isHighSurrogate(char16_t unit) noexcept {
    return unit >= 0xD800 && unit <= 0xDBFF;
}

bool belongsToError(TextSource source) noexcept {
    return source == TextSource::Error || source == TextSource::ShownError;
}

}  // namespace

TextOutput::TextOutput(Settings settings, Emit emit)
    : settings_(settings),
      emit_(std::move(emit)),
      requestThread_(std::this_thread::get_id()),
      timer_([this] { runTimer(); }) {}

TextOutput::~TextOutput() {
    {
        const std::lock_guard lock(mutex_);
        handOn();
        ending_ = true;
    }
    changed_.notify_one();
    timer_.join();
}

void TextOutput::begin(const Request& request) {
    const std::lock_guard lock(mutex_);
    handOn();
    running_.push_back(request);
}

void TextOutput::suspend() {
    begin({});
}

void TextOutput::end() {
    // Under one lock, so that no other thread adds text to the request after this.
    const std::lock_guard lock(mutex_);
    handOn();
    running_.pop_back();
}

bool TextOutput::write(TextSource source, std::u16string_view text) {
    if (text.empty()) {
        return false;
    }
    bool wake = false;
    bool handedOn = false;
    {
        const std::lock_guard lock(mutex_);
        const std::optional<TextTarget> target = route(source);
        if (!target) {
            return false;
        }
        handedOn = std::exchange(handedOnLate_, false);
        // One piece is held for all targets, so that the order between them is the order of writing.
        if (!held_.empty() && !(target_ == *target)) {
            handedOn = handOn() || handedOn;
        }
        const bool sparing = target->stream != 0 && running_.back().message->getOkToFlushSparingly();
        wake = held_.empty();
        if (wake) {
            target_ = *target;
            due_ = Clock::now() + (sparing ? settings_.sparingDelay : settings_.delay);
        }
        held_ += text;
        const bool lineEnds = !sparing && text.find(u'\n') != std::u16string_view::npos;
        if (lineEnds || held_.size() >= settings_.flushUnits) {
            handedOn = handOn() || handedOn;
            wake = false;
        }
    }
    if (wake) {
        changed_.notify_one();
    }
    return handedOn;
}

bool TextOutput::flush() {
    const std::lock_guard lock(mutex_);
    return handOn();
}

krutil::io::SinkTraits TextOutput::outputTraits() const {
    const std::lock_guard lock(mutex_);
    const bool none = running_.empty() || !running_.back().message;
    return none ? krutil::io::SinkTraits() : running_.back().message->getIIP()->getOutTraits();
}

std::optional<TextTarget> TextOutput::route(TextSource source) const {
    if (source == TextSource::PlainOutput || source == TextSource::PlainError) {
        TextTarget target;
        target.type = source == TextSource::PlainError ? StreamTypeEnum::ERROR_STREAM : StreamTypeEnum::GENERIC_STREAM;
        return target;
    }
    if (running_.empty() || !running_.back().message) {
        return TextTarget{};
    }
    const Request& request = running_.back();
    const cmddistributor::IIP& iip = *request.message->getIIP();
    const krutil::io::SinkTraits& traits = belongsToError(source) ? iip.getErrTraits() : iip.getOutTraits();
    TextTarget target;
    target.stream = request.stream;
    target.id = request.id();
    target.diary = traits.getUseDiary();
    target.log = traits.getUseLogging();

    const IqmStreamID streams = iip.getStreamID();
    if (std::this_thread::get_id() != requestThread_) {
        const bool all = streams == IqmStreamID::ekIqmAllStreams || streams == IqmStreamID::ekIqmJavaStream;
        return all ? target : TextTarget{};
    }
    // A number that no stream has acts as the command window.
    if (streams == IqmStreamID::ekIqmNoStreams) {
        return std::nullopt;
    }
    target.type = belongsToError(source) ? StreamTypeEnum::ERROR_STREAM : StreamTypeEnum::OUTPUT_STREAM;
    target.shown = source == TextSource::ShownOutput || source == TextSource::ShownError;
    return target;
}

bool TextOutput::handOn() {
    if (held_.empty()) {
        return false;
    }
    std::u16string text = std::exchange(held_, {});
    while (text.size() > settings_.maxUnits) {
        std::size_t length = settings_.maxUnits;
        if (isHighSurrogate(text[length - 1])) {
            --length;
        }
        emit_(target_, text.substr(0, length));
        text.erase(0, length);
    }
    emit_(target_, std::move(text));
    return true;
}

void TextOutput::runTimer() {
    std::unique_lock lock(mutex_);
    while (!ending_) {
        if (held_.empty()) {
            changed_.wait(lock);
        } else if (changed_.wait_until(lock, due_) == std::cv_status::timeout && !held_.empty() &&
                   Clock::now() >= due_) {
            handedOnLate_ = handOn();
        }
    }
}

}  // namespace qvm
