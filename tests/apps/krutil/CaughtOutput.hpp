// What the client prints, caught in pipes.
#pragma once

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "krutil/base/Interrupt.hpp"
#include "krutil/base/Output.hpp"
#include "support/Pipe.hpp"

namespace krutil_client {

/// Both outputs of the client, and where they go.
struct CaughtOutput {
    Interrupt interrupt;
    test_support::Pipe outPipe;
    test_support::Pipe errPipe;
    Output out{outPipe.write.get(), "standard output", interrupt};
    Output err{errPipe.write.get(), "standard error", interrupt};
};

/// A test of printers, which subscribe to `events`.
class PrinterFixture : public ::testing::Test, protected CaughtOutput {
  protected:
    template <class EventT, class... Arguments>
    void publish(Arguments&&... arguments) {
        events.publish(boost::make_shared<const EventT>(std::forward<Arguments>(arguments)...));
    }

    foundation::msg_svc::eventmgr::EventMgr events;
};

}  // namespace krutil_client
