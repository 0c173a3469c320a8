// Calls of the engine's functions: those that a person asks for, and those that the program itself asks for.
#pragma once

#include <boost/shared_ptr.hpp>
#include <chrono>
#include <cstddef>
#include <string>
#include <vector>

#include "cmddistributor/IIP.hpp"
#include "foundation/korveldata/Array.hpp"
#include "krutil/base/Options.hpp"
#include "krutil/cmddistributor/IIPReply.hpp"
#include "krutil/session/Client.hpp"

namespace krutil_client {

/// A call of a function, of which so many outputs are wanted.
struct FunctionCall {
    std::string function;  ///< dotted name, UTF-8
    std::size_t outputs = 1;
    std::vector<foundation::korveldata::Array> arguments{};
};

/// The request for a call.
boost::shared_ptr<const cmddistributor::IIP> requestOf(const Client& client, FunctionCall call,
                                                       const SinkOptions& options);

/// The outputs that a reply holds; none for one that holds an error.
std::vector<foundation::korveldata::Array> outputsOf(const krutil::cmddistributor::IIPReply& reply);

/// What came of a quiet call.
struct QuietAnswer {
    enum class End {
        Returned,  ///< with as many outputs as were asked for
        Failed,    ///< the engine has no such function, or it has raised an error
        Late,      ///< there was no answer in time, or the engine did not run it
    };
    End end = End::Late;
    std::vector<foundation::korveldata::Array> outputs{};
};

/// Makes a call, and delivers until it is answered or `patience` has passed; then it is cancelled. A person sees
/// nothing of it: neither its events nor its error are shown, and the list of requests does not have it. The engine
/// takes it when it is idle, and at prompts that take code. Throws what Conversation::runUntil() throws.
QuietAnswer callQuietly(Client& client, FunctionCall call, std::chrono::milliseconds patience);

}  // namespace krutil_client
