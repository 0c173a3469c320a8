// The embedded Python of one session.
#pragma once

#include <Python.h>

#include <boost/optional.hpp>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/RuntimeException.hpp"
#include "foundation/korveldata/Array.hpp"
#include "qvm/python/ErrorRecord.hpp"
#include "qvm/python/PythonChoice.hpp"
#include "qvm/requests/MessageBounds.hpp"

namespace qvm {

/// Runs code in one namespace, which lives as long as the object: what one request defines, the next finds. One object
/// a process. The thread that makes it is Python's main thread; it holds the interpreter lock all the time but for
/// unlocked(), and all members are for that thread.
class Interpreter {
  public:
    /// How an evaluation or a call ended.
    struct Ending {
        boost::optional<cmddistributor::RuntimeException> error{};
        std::u16string printed{};  ///< the error as Python prints it; empty for none and for ends that are no failures
        bool exit = false;         ///< the code asked for the end of the session
        std::optional<std::vector<foundation::korveldata::Array>> outputs{};  ///< of a call that succeeded
    };

    /// What becomes of the memory of a call's outputs.
    enum class Outputs { Shared, Copied };

    /// Starts Python, where it has not been prepared. Throws std::runtime_error with Python's reason.
    Interpreter(const PythonConfig& world, const MessageBounds& bounds);

    /// Leaves Python as it is, because threads of running code may still be in it: the process is about to end. Builds
    /// with a sanitizer finalise it where they can, so that leaks show.
    ~Interpreter();
    Interpreter(const Interpreter&) = delete;
    Interpreter& operator=(const Interpreter&) = delete;

    /// Runs the request's text as its code type says. Nothing that the text raises leaves this function, SystemExit
    /// included. An interrupt that comes while its error is put into words is the error then. In a process that the
    /// text has forked it does not return. `frame` is one that stands still, whose variables the text sees and assigns;
    /// null for the namespace of the session. `file` is the absolute path that the text comes from, UTF-8; empty for
    /// none. Tracebacks name it and show its lines as they are in the text, `__file__` and the first entry of sys.path
    /// are as when Python runs it; in a frame only the tracebacks are. Evaluations nest.
    Ending evaluate(const cmddistributor::EvalIIP& request, const std::string& file, PyObject* frame = nullptr);

    /// Calls the function that the request names with the arrays that it carries, which are taken out of it, and
    /// returns as many outputs as it asks for; see FunctionCall.hpp. Unless they are to be copied, the outputs share
    /// memory with Python: it comes back through dropReleased(), and nothing that could write to it should run before
    /// they are sent. Everything else is as for evaluate().
    Ending call(const cmddistributor::FEvalIIP& request, Outputs outputs);

    /// Does what is to be done when a request has ended that no prompt holds, such as showing the pictures that it left
    /// open; nothing when the code has ended the session or was interrupted. What is raised meanwhile becomes the error
    /// of an ending without one.
    void endRequest(Ending& ending);

    /// Drops Python's share in the memory of outputs that are not used any more, on whatever thread they ended.
    void dropReleased() noexcept;

    /// Readable when dropReleased() has something to do.
    int releasedDescriptor() const noexcept;

    /// Runs handlers of signals that have arrived since the last evaluation. An interrupt has nothing to end any more
    /// and is dropped.
    void handleSignals() noexcept;

    /// Calls `wait` without the interpreter lock, so that threads of running code go on.
    void unlocked(const std::function<void()>& wait);

    /// Runs exit functions and flushes open files. Call once, when nothing will be evaluated any more.
    void finish() noexcept;

  private:
    struct State;

    // Text, or that the code that was to give it has been interrupted.
    struct Printed {
        std::u16string text;
        bool interrupted = false;
    };

    // The ending by the Python exception that is set.
    Ending failure(krutil::cmddistributor::inExecutionStatus status);
    Printed printedText(PyObject* exception, const cmddistributor::RuntimeException& record) const;

    const RecordBounds bounds_;
    const std::size_t printedCharacters_;
    std::unique_ptr<State> state_;
    std::uint64_t evaluations_ = 0;
};

}  // namespace qvm
