// Python objects whose memory something outside Python has borrowed, on their way back.
//
// A frame that is being sent reads from a NumPy array's own memory, and lets go of it on whatever thread wrote its last
// byte. That thread must not wait for the interpreter lock: it would wait behind the running code, and the lock is gone
// when Python is. So it only puts the object into this queue and wakes the interpreter's thread, which drops the
// reference. What comes back after the queue was last drained is never dropped: the process is about to end, and Python
// may have ended before it.
#pragma once

#include <Python.h>

#include <memory>

namespace qvm {

/// Objects handed out by hold() may outlive the queue. drain() and hold() are for holders of the interpreter lock.
class ReleaseQueue {
  public:
    /// Throws std::system_error when the system has no descriptor left.
    ReleaseQueue();
    ~ReleaseQueue();
    ReleaseQueue(const ReleaseQueue&) = delete;
    ReleaseQueue& operator=(const ReleaseQueue&) = delete;

    /// A share in `object` that any thread may drop, with or without the interpreter lock. Throws std::bad_alloc.
    std::shared_ptr<const void> hold(PyObject* object);

    /// Drops the references that have come back. Runs the finalisers of what goes with them.
    void drain() noexcept;

    /// Readable when drain() has something to do.
    int descriptor() const noexcept;

  private:
    struct Held;
    class Core;

    const std::shared_ptr<Core> core_;
};

}  // namespace qvm
