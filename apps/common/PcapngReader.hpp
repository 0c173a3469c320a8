// Reads files of the format pcapng as far as recordings of sessions need it.
#pragma once

#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include "foundation/core/posix/OwnedDescriptor.hpp"

namespace apps {

/// What is no recording, or a damaged one: the sentence names the file, the byte offset, what was expected and what is
/// there.
class RecordingError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

/// Reads the packets of a file that grows perhaps, or of a pipe. Blocks of other types, and packets that are not marked
/// for this system's dissector, are skipped, whatever their size. Files of both byte orders are read.
///
/// Memory is taken for bytes that have arrived, not for what a length claims. Not synchronised.
class PcapngReader {
  public:
    /// One process that has recorded a session; each section of a file has its own.
    struct Interface {
        std::string name;     ///< empty for none
        std::string program;  ///< what made the section; empty if it does not say
        std::string comment;  ///< of the section; empty for none
    };

    struct Packet {
        std::uint64_t offset = 0;       ///< of its block in the file
        std::size_t interface = 0;      ///< position in interfaces()
        std::uint64_t nanoseconds = 0;  ///< since 1970, UTC
        bool outbound = false;
        std::uint64_t missing = 0;          ///< bytes behind `data` that were not recorded
        std::vector<std::string> comments;  ///< most have none
        std::string_view data;              ///< without the tags; valid until the next call of next()
    };

    /// "-" reads standard input. `wait` is called with the descriptor before each read, which may block otherwise;
    /// empty for nothing. Throws std::system_error with a sentence.
    explicit PcapngReader(const std::string& file, std::function<void(int)> wait = nullptr);

    /// The next packet; empty at the end of what is there. A later call goes on when there is more. Throws
    /// RecordingError, and std::system_error when the file cannot be read.
    std::optional<Packet> next();

    const std::vector<Interface>& interfaces() const noexcept { return interfaces_; }

    /// How errors call the file.
    const std::string& name() const noexcept { return name_; }

    /// The bytes that have been read.
    std::uint64_t size() const noexcept { return position_ + (buffer_.size() - begin_); }

    /// Whether what is there ends between two blocks.
    bool atBoundary() const noexcept { return buffer_.size() - begin_ == consumed_ && !skipping_; }

    /// Throws a RecordingError about what is at `offset` in the file.
    [[noreturn]] void fail(std::uint64_t offset, const std::string& what, const std::string& expected,
                           const std::string& got) const;

  private:
    // Of the interfaces of this section.
    struct Description {
        std::size_t number;
        std::uint16_t linkType;
        std::uint64_t nanosecondsPerUnit;
    };
    struct Skipping {
        std::uint64_t left;  ///< bytes in front of the second length
        std::uint32_t length;
    };

    bool fill(std::size_t count);
    bool nextBlock();
    bool skip();
    void checkLength(std::size_t least, const char* where) const;
    void beginSection();
    void addInterface();
    std::optional<Packet> packet();
    void forEachOption(std::string_view options,
                       const std::function<void(std::uint16_t, std::string_view)>& take) const;
    template <class Number>
    Number number(std::string_view bytes, std::size_t offset) const;
    std::string_view block() const { return std::string_view(buffer_).substr(begin_, consumed_); }

    std::string name_;
    foundation::core::posix::OwnedDescriptor owned_;
    int descriptor_ = STDIN_FILENO;
    std::function<void(int)> wait_;

    std::string buffer_;
    std::size_t begin_ = 0;       ///< in the buffer, of the block that is next or was the last
    std::size_t consumed_ = 0;    ///< bytes of that block, once it was taken
    std::uint64_t position_ = 0;  ///< in the file, of `begin_`
    std::optional<Skipping> skipping_;
    bool swapped_ = false;  ///< numbers of this section are big-endian
    std::string program_;   ///< of this section
    std::string comment_;   ///< of this section
    std::vector<Description> section_;
    std::vector<Interface> interfaces_;
};

}  // namespace apps
