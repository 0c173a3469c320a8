#include "krutil/inspect/RedactedCopy.hpp"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/uio.h>

#include <cerrno>
#include <cstdint>
#include <system_error>

#include "common/PcapngBlocks.hpp"
#include "common/RecordingReader.hpp"
#include "foundation/core/posix/OwnedDescriptor.hpp"
#include "foundation/core/posix/writeFully.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/inspect/Redaction.hpp"

namespace krutil_client {
namespace {

namespace pcapng = apps::pcapng;
namespace posix = foundation::core::posix;

class Copy {
  public:
    explicit Copy(const std::string& name)
        : name_(name),
          file_(::open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOCTTY | O_CLOEXEC, S_IRUSR | S_IWUSR)) {
        if (!file_) {
            fail("create");
        }
    }

    void add(const apps::RecordedSession& session) {
        const std::string comment =
            session.repeated ? "continued: repeats " + std::to_string(*session.repeated) + " packets of an earlier file"
                             : std::string();
        pcapng::makeSection(block_, comment, isBuild(session.program) ? session.program : "redacted",
                            redactedProcess(session.process));
        write();
    }

    void add(apps::RecordedUnit& unit) {
        const iovec piece{unit.bytes.data(), unit.bytes.size()};
        const pcapng::Unit packets{unit.direction == apps::RecordedUnit::Direction::Sent,
                                   unit.nanoseconds,
                                   {&piece, 1},
                                   unit.bytes.size(),
                                   unit.size};
        for (std::uint64_t first = 0; first < packets.kept;) {
            first += pcapng::makePacket(block_, packets, first);
            write();
        }
    }

  private:
    // "client 123", and nothing behind.
    static std::string redactedProcess(const std::string& process) {
        return process.substr(0, process.find_first_not_of("0123456789", std::string("client ").size()));
    }

    void write() {
        if (!posix::writeFully(file_.get(), block_)) {
            fail("write to");
        }
    }

    [[noreturn]] void fail(const char* what) const {
        throw Failure(ExitCode::Usage,
                      std::string("cannot ") + what + " '" + name_ + "': " + std::generic_category().message(errno));
    }

    const std::string name_;
    const posix::OwnedDescriptor file_;
    std::string block_;
};

}  // namespace

std::optional<std::string> redactRecording(const std::string& file, const std::string& out) {
    try {
        apps::RecordingReader reader(file);
        Copy copy(out);
        std::size_t sessions = 0;
        while (auto unit = reader.next()) {
            if (unit->session + 1 < sessions) {
                throw Failure(ExitCode::Usage,
                              "cannot redact " + reader.name() + ": byte " + std::to_string(unit->offset) +
                                  ": expected the sessions one behind the other, got them mixed; redact "
                                  "recordings before they are merged");
            }
            for (; sessions <= unit->session; ++sessions) {
                copy.add(reader.sessions()[sessions]);
            }
            redact(*unit);
            copy.add(*unit);
        }
        return reader.unfinished();
    } catch (const apps::RecordingError& error) {
        throw Failure(ExitCode::Usage, error.what());
    } catch (const std::system_error& error) {
        throw Failure(ExitCode::Usage, error.what());
    }
}

}  // namespace krutil_client
