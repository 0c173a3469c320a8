// What a text sink wants.
#pragma once

namespace krutil::io {

class SinkTraits {
  public:
    explicit SinkTraits(bool own, bool links, bool layout, bool diary, bool echo, bool log)
        : own_(own), links_(links), layout_(layout), diary_(diary), echo_(echo), log_(log) {}
    virtual ~SinkTraits() = default;
    SinkTraits(const SinkTraits&) = default;
    SinkTraits& operator=(const SinkTraits&) = default;

    /// Whether the sink is this process's own.
    bool own() const { return own_; }
    bool getSupportsHotlinks() const { return links_; }
    bool getNeedsFormattingForDisplay() const { return layout_; }
    bool getUseDiary() const { return diary_; }
    bool getUseEcho() const { return echo_; }
    bool getUseLogging() const { return log_; }

  private:
    bool own_ : 1, links_ : 1, layout_ : 1, diary_ : 1, echo_ : 1, log_ : 1;
};

}  // namespace krutil::io
