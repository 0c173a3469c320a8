#include "engine/ListeningEngine.hpp"

#include <unistd.h>

#include <stdexcept>
#include <string>

namespace bench {

// What the engine says on its standard error comes on its stream.
ListeningEngine::ListeningEngine()
    : process_(krutil_client::EngineProcess::start(
          {"/bin/sh", "-c", R"(exec "$0" --listen "$1" 2>&1)", KRUTIL_QVM, directory_.file("engine")})) {
    std::string said;
    for (char each = 0; each != '\n'; said += each) {
        if (::read(process_.stream(), &each, 1) != 1) {
            throw std::runtime_error("an engine that listens: expected that it serves, got \"" + said + "\"");
        }
    }
}

krutil_client::EngineProcess ListeningEngine::connect() const {
    return krutil_client::EngineProcess::connect(directory_.file("engine"));
}

}  // namespace bench
