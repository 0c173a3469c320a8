// An engine that listens.
#pragma once

#include "krutil/session/EngineProcess.hpp"
#include "support/TemporaryDirectory.hpp"

namespace bench {

/// Ends with the object. Single thread.
class ListeningEngine {
  public:
    /// Blocks until the engine listens.
    ListeningEngine();

    /// A new session's stream.
    krutil_client::EngineProcess connect() const;

  private:
    test_support::TemporaryDirectory directory_;
    krutil_client::EngineProcess process_;
};

}  // namespace bench
