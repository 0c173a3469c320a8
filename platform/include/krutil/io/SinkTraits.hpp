// What the place that shows a request's text can do and wants.
#pragma once

namespace krutil::io {

/// Traits of one text sink (output or error). A value; copies are independent.
class SinkTraits {
  public:
    /// All false.
    SinkTraits() noexcept = default;

    /// `untransmitted` stays in the process: a copy rebuilt from a stream has it false.
    SinkTraits(bool untransmitted, bool supportsHotlinks, bool needsFormattingForDisplay, bool useDiary, bool useEcho,
               bool useLogging) noexcept;
    SinkTraits(const SinkTraits&) noexcept = default;             ///< copies every trait
    SinkTraits& operator=(const SinkTraits&) noexcept = default;  ///< copies every trait
    virtual ~SinkTraits();

    /// Set by the process that owns the sink; never travels.
    bool getUntransmitted() const noexcept { return untransmitted_; }
    /// The sink makes links out of hyperlink markup.
    bool getSupportsHotlinks() const noexcept { return supportsHotlinks_; }
    /// Values are laid out for a person to read rather than in their shortest form.
    bool getNeedsFormattingForDisplay() const noexcept { return needsFormattingForDisplay_; }
    /// The text is appended to the engine's diary as well.
    bool getUseDiary() const noexcept { return useDiary_; }
    /// The command is shown before what it prints.
    bool getUseEcho() const noexcept { return useEcho_; }
    /// The text is written to the engine's log as well.
    bool getUseLogging() const noexcept { return useLogging_; }

    /// The same in every trait, the one that does not travel included.
    bool operator==(const SinkTraits& other) const noexcept;

  private:
    bool untransmitted_ = false;
    bool supportsHotlinks_ = false;
    bool needsFormattingForDisplay_ = false;
    bool useDiary_ = false;
    bool useEcho_ = false;
    bool useLogging_ = false;
};

}  // namespace krutil::io
