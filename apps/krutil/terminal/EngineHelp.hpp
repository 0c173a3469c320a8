// What the line editor asks the engine on behalf of a person who types.
#pragma once

#include <optional>
#include <string>

#include "krutil/session/Client.hpp"
#include "krutil/terminal/Completion.hpp"

namespace krutil_client {

/// Asks by quiet calls, each with a time limit. An engine that cannot complete is not asked for that again. Main thread
/// only. All members throw what callQuietly() throws.
class EngineHelp {
  public:
    /// `client` must outlive the object.
    explicit EngineHelp(Client& client) noexcept : client_(client) {}

    /// How code may go on. Nothing for an engine that cannot complete; no candidates when there are none, when the
    /// engine is busy, and when it takes too long.
    std::optional<Completions> complete(const std::wstring& text, std::size_t cursor);

    /// Signature and documentation of a name, UTF-8. Empty when there is none; nothing when the engine cannot say.
    std::optional<std::string> inspect(const std::string& name);

    /// The version of the engine's Python, such as "3.11.2"; empty when it is not told.
    std::string pythonVersion();

    /// Has values cut in this session at so many elements a level when they are shown; an engine that cannot shows all.
    void shorten(int limit);

  private:
    Client& client_;
    bool completes_ = true;
};

}  // namespace krutil_client
