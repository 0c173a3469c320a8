// Text of a stream. Immutable.
#pragma once

#include <string>

#include "krutil/io/StreamTypeEnum.hpp"

namespace krutil::io {

class TextBase {
  public:
    TextBase(StreamTypeEnum kind, std::u16string words) : kind_(kind), words_(std::move(words)) {}
    virtual ~TextBase() = default;

    StreamTypeEnum getStreamType() const { return kind_; }
    std::u16string getText() const { return words_; }

  private:
    StreamTypeEnum kind_;
    std::u16string words_;
};

}  // namespace krutil::io
