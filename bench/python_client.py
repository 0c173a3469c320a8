"""What the client for Python does in questions that the C++ client answers too, each with an engine of its own."""

import contextlib
import time

# The functions of the same names that the C++ client calls.
FUNCTIONS = "def take(array): pass\ndef read(array): array[::64].max()\ndef back(array): return array\n"


@contextlib.contextmanager
def evaluations(run):
    """Work by the label of the row in which the C++ client does the same; a call of it is one time."""
    import krutil  # Only a run that asks has what it needs, and knows where it is.

    def evaluate():
        result = session.eval("1+1")
        if result.value != "2":
            raise RuntimeError(f"the client for Python: expected 2, got {result}")

    with krutil.start([run.program("bin", "krutil-qvm"), "--stdio"]) as session:
        for _ in range(400):  # Python makes code quicker that has run some hundred times.
            evaluate()
        yield {"": evaluate}


def _calls(session, array):
    def back():
        got = session.call("back", array)
        if got.nbytes != array.nbytes:
            raise RuntimeError(f"the client for Python: expected {array.nbytes} bytes, got {got.nbytes}")

    session.eval(FUNCTIONS)
    for _ in range(3):  # Memory of the first results is another one than that of those that follow.
        if not (session.call("back", array) == array).all():
            raise RuntimeError("the client for Python: what came back is not what was sent")
    return {"to the engine": lambda: session.call("take", array, outputs=0),
            "to the engine, which reads it": lambda: session.call("read", array, outputs=0),
            "there and back": back}


def _large(array):
    import numpy
    array[:] = numpy.arange(array.size) % 251
    return array


@contextlib.contextmanager
def arrays(run):
    """As `evaluations()`, with 64 MiB over the socket."""
    import krutil
    import numpy
    with krutil.start([run.program("bin", "krutil-qvm"), "--stdio", "--no-shared-memory"]) as session:
        calls = _calls(session, _large(numpy.empty(1 << 26, numpy.uint8)))
        yield {f"64 MiB {way}": calls[way] for way in ("to the engine", "there and back")}


@contextlib.contextmanager
def shared_arrays(run):
    """As `evaluations()`, with 64 MiB in shared memory. What nobody reads is no question of its size, and left out."""
    import krutil
    import numpy
    with krutil.start([run.program("bin", "krutil-qvm"), "--stdio"]) as session:
        calls = _calls(session, _large(krutil.empty(1 << 26, numpy.uint8)))
        yield {f"64 MiB {way}": calls[way] for way in ("to the engine, which reads it", "there and back")}


def seconds_of(work, batch):
    """What one time takes, from as many as fit into the seconds of a batch. Before, it is tried as the C++ client's is."""
    def seconds(count):
        begin = time.perf_counter()
        for _ in range(count):
            work()
        return time.perf_counter() - begin

    count, took = 1, seconds(1)
    while took < batch / 4:
        count *= 2
        took = seconds(count)
    count = max(1, round(count * batch / took))
    return seconds(count) / count
