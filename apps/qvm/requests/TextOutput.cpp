#include "qvm/requests/TextOutput.hpp"

#include <algorithm>
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

TextOutput::TextOutput(Settings settings, Emit emit, Expect expect)
    : settings_(settings),
      emit_(std::move(emit)),
      expect_(std::move(expect)),
      requestThread_(std::this_thread::get_id()) {}

TextOutput::~TextOutput() {
    flush();
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
    const std::lock_guard lock(mutex_);
    const std::optional<TextTarget> target = route(source);
    if (!target) {
        return false;
    }
    bool handedOn = std::exchange(handedOnLate_, false);
    // One piece is held for all targets, so that the order between them is the order of writing.
    if (!held_.empty() && !(target_ == *target)) {
        handedOn = handOn() || handedOn;
    }
    const bool sparing = target->stream != 0 && running_.back().message->getOkToFlushSparingly();
    const bool lineEnds = !sparing && text.find(u'\n') != std::u16string_view::npos;
    const bool first = held_.empty();
    held_ += text;
    if (!first && !lineEnds && held_.size() < settings_.flushUnits) {
        return handedOn;
    }
    const Clock::time_point now = Clock::now();
    if (first) {
        target_ = *target;
        due_ = now + (sparing ? settings_.sparingDelay : settings_.delay);
    }
    if (held_.size() >= settings_.flushUnits || (lineEnds && now >= nextLine_)) {
        handedOn = handOn() || handedOn;
        nextLine_ = now + settings_.lineGap;
        return handedOn;
    }
    if (lineEnds) {
        due_ = std::min(due_, nextLine_);
    }
    expect_(due_);
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

FlushTimer::Time TextOutput::flushDue(FlushTimer::Time now) {
    const std::lock_guard lock(mutex_);
    if (!held_.empty() && due_ <= now) {
        handedOnLate_ = handOn();
        nextLine_ = Clock::now() + settings_.lineGap;
    }
    return held_.empty() ? FlushTimer::never : due_;
}

}  // namespace qvm
