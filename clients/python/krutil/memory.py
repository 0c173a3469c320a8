"""Memory for contents that come in the stream. That of large ones is kept for the next content of its size.

The system clears fresh memory before it may be used. That takes a fifth of the time of a call with 64 MiB.
"""

import contextlib
import mmap
import weakref

import numpy

#: Contents below this many bytes have memory of NumPy, where reuse is left to the C library.
SMALLEST_KEPT = 1 << 20

#: As many bytes are kept for all sessions of this process together.
MOST_KEPT = 256 << 20

# The oldest first. An array may end in any thread, and in the middle of what is below. A lock would be in the way there,
# and after a fork. So there is none: a step that changes the list is one call of it.
_kept: list[mmap.mmap] = []


def memory_for(size: int) -> memoryview:
    """Memory of so many bytes that can be written to. It may show a content of before until it is filled, and it is
    address space only until then. Once nobody refers to it any more, it may be handed out again. Raises `MemoryError`.
    """
    if size < SMALLEST_KEPT:
        return numpy.empty(size, numpy.uint8).data
    memory = _kept_of(size) or _fresh(size)
    elements = numpy.frombuffer(memory, numpy.uint8)
    weakref.finalize(elements, _keep, memory).atexit = False
    return elements.data


def _kept_of(size: int) -> "mmap.mmap | None":
    for memory in tuple(_kept):
        if len(memory) == size:
            try:
                _kept.remove(memory)
                return memory
            except ValueError:
                pass  # Another thread was quicker.
    return None


def _fresh(size: int) -> mmap.mmap:
    try:
        memory = mmap.mmap(-1, size, mmap.MAP_PRIVATE | mmap.MAP_ANONYMOUS)
    except (OSError, OverflowError) as error:
        raise MemoryError(str(error)) from None
    with contextlib.suppress(OSError):  # A system without large pages does as well.
        memory.madvise(mmap.MADV_HUGEPAGE)
    return memory


def _keep(memory: mmap.mmap) -> None:
    if len(memory) > MOST_KEPT:
        return
    # What is in it is of no use any more. The system may take its pages when it needs some.
    memory.madvise(mmap.MADV_FREE)
    _kept.append(memory)
    while sum(map(len, tuple(_kept))) > MOST_KEPT:
        try:
            _kept.pop(0)
        except IndexError:
            break  # Other threads have made room.
