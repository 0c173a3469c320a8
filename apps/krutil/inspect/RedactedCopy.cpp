#include "krutil/inspect/RedactedCopy.hpp"

#include <sys/uio.h>

#include <cstdint>
#include <system_error>

#include "common/PcapngBlocks.hpp"
#include "common/RecordingReader.hpp"
#include "krutil/base/ExitCode.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/inspect/NewFile.hpp"
#include "krutil/inspect/Redaction.hpp"

namespace krutil_client {
namespace {

namespace pcapng = apps::pcapng;

class Copy {
  public:
    explicit Copy(const std::string& name) : file_(name) {}

    void add(const apps::RecordedSession& session) {
        const std::string comment =
            session.repeated ? "continued: repeats " + std::to_string(*session.repeated) + " packets of an earlier file"
                             : std::string();
        pcapng::makeSection(block_, comment, isBuild(session.program) ? session.program : "redacted",
                            redactedProcess(session.process));
        file_.write(block_);
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
            file_.write(block_);
        }
    }

    void keep() noexcept { file_.keep(); }

  private:
    // "client 123", and nothing behind.
    static std::string redactedProcess(const std::string& process) {
        return process.substr(0, process.find_first_not_of("0123456789", std::string("client ").size()));
    }

    NewFile file_;
    std::string block_;
};

void copyUnits(apps::RecordingReader& reader, Copy& copy) {
    std::size_t sessions = 0;
    while (auto unit = reader.next()) {
        if (unit->session + 1 < sessions) {
            throw Failure(ExitCode::Usage, "cannot redact " + reader.name() + ": byte " + std::to_string(unit->offset) +
                                               ": expected the sessions one behind the other, got them mixed; redact "
                                               "recordings before they are merged");
        }
        for (; sessions <= unit->session; ++sessions) {
            copy.add(reader.sessions()[sessions]);
        }
        redact(*unit);
        copy.add(*unit);
    }
}

}  // namespace

std::optional<std::string> redactRecording(const std::string& file, const std::string& out, Interrupt& interrupt) {
    try {
        apps::RecordingReader reader(file, [&interrupt](int fd) { interrupt.waitForInput(fd); });
        Copy copy(out);
        try {
            copyUnits(reader, copy);
        } catch (const Cancelled&) {
            // Who follows a recording and ends that wants what has come.
            copy.keep();
            throw;
        }
        copy.keep();
        return reader.unfinished();
    } catch (const apps::RecordingError& error) {
        throw Failure(ExitCode::Usage, error.what());
    } catch (const std::system_error& error) {
        throw Failure(ExitCode::Usage, error.what());
    }
}

}  // namespace krutil_client
