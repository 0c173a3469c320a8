// The text part of a text event.
#pragma once

#include <string>
#include <utility>

#include "krutil/io/StreamTypeEnum.hpp"

namespace krutil::io {

/// A piece of text and the stream it belongs to. Immutable.
class TextBase {
  public:
    /// `text` is UTF-16.
    TextBase(StreamTypeEnum streamType, std::u16string text) noexcept
        : text_(std::move(text)), streamType_(streamType) {}
    virtual ~TextBase();

    /// The stream that the text belongs to.
    StreamTypeEnum getStreamType() const noexcept { return streamType_; }
    /// UTF-16.
    const std::u16string& getText() const noexcept { return text_; }

  private:
    std::u16string text_;
    StreamTypeEnum streamType_;
};

}  // namespace krutil::io
