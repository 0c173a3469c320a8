// What the client prints, caught in pipes.
#pragma once

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>

#include "Interrupt.hpp"
#include "Output.hpp"
#include "Pipe.hpp"
#include "foundation/msg_svc/eventmgr/EventMgr.hpp"

namespace client {

/// Both outputs of the client, and where they go.
struct CaughtOutput {
    Interrupt interrupt;
    Pipe outPipe;
    Pipe errPipe;
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

}  // namespace client
