"""Memory that both ends of a session see: contents of arrays that are not sent, but mapped.

docs/session-wire.md says what memory is accepted, and when each end may do what with it.
"""

import ctypes
import fcntl
import itertools
import mmap
import os
import struct
import threading
import weakref
from typing import Any, Callable, Optional, Sequence, Union

import numpy
import numpy.typing

from .wire import DescriptorQueue, Violation

#: Contents below this many bytes travel in the stream.
SMALLEST = 1 << 20

_SEALS = {2: "SHRINK", 4: "GROW", 8: "WRITE", 16: "FUTURE_WRITE", 1: "SEAL"}
_REQUIRED = 2 | 4 | 16 | 1
_TMPFS = 0x01021994
_BLOCK = 512  # of st_blocks
_MAP_NORESERVE = 0x4000
_MAP_FIXED = 0x10
_PROT_NONE = 0
_MADV_COLLAPSE = 25
_LARGE_PAGE = 2 << 20
_CONTENT = struct.Struct("<QQQ")

_libc = ctypes.CDLL(None, use_errno=True)
_libc.mmap.restype = ctypes.c_void_p
_libc.mmap.argtypes = [ctypes.c_void_p, ctypes.c_size_t, ctypes.c_int, ctypes.c_int, ctypes.c_int, ctypes.c_long]
_libc.munmap.argtypes = [ctypes.c_void_p, ctypes.c_size_t]
_libc.madvise.argtypes = [ctypes.c_void_p, ctypes.c_size_t, ctypes.c_int]

# How often this process has forked. A child keeps what was mapped then.
_forks = 0


def _count_fork() -> None:
    global _forks
    _forks += 1


os.register_at_fork(before=_count_fork)


def _map_at_large_page(descriptor: int, offset: int, size: int, flags: int) -> int:
    """Maps memory, to be read and written, where large pages can begin. Raises `OSError`."""
    size = -(-size // mmap.PAGESIZE) * mmap.PAGESIZE
    room = size + _LARGE_PAGE
    begin = _mapped(None, room, _PROT_NONE, mmap.MAP_PRIVATE | mmap.MAP_ANONYMOUS | _MAP_NORESERVE, -1, 0)
    address = -(-begin // _LARGE_PAGE) * _LARGE_PAGE
    try:
        _mapped(address, size, mmap.PROT_READ | mmap.PROT_WRITE, flags | _MAP_FIXED, descriptor, offset)
    except OSError:
        _libc.munmap(begin, room)
        raise
    if address > begin:
        _libc.munmap(begin, address - begin)
    if begin + room > address + size:
        _libc.munmap(address + size, begin + room - address - size)
    return address


def _mapped(address: Optional[int], size: int, protection: int, flags: int, descriptor: int, offset: int) -> int:
    made = _libc.mmap(address, size, protection, flags, descriptor, offset)
    if made in (None, ctypes.c_void_p(-1).value):
        raise OSError(ctypes.get_errno(), os.strerror(ctypes.get_errno()))
    return int(made)


# Memory of arrays, by address. Each use of it is one step of a dict, which no other thread comes between: memory goes in
# any thread, at any time.
_memories: "dict[int, weakref.ref[_Memory]]" = {}


class _Memory:
    """Memory of this process that engines may map, as what NumPy makes arrays of. It lives as long as any of these."""

    def __init__(self, size: int) -> None:
        self.size = size
        self.descriptor = os.memfd_create("krutil", os.MFD_CLOEXEC | os.MFD_ALLOW_SEALING)
        try:
            # Without holes: the receiver refuses these, since reading them would cost its memory.
            os.posix_fallocate(self.descriptor, 0, size)
            self.address = _map_at_large_page(self.descriptor, 0, size, mmap.MAP_SHARED)
        except BaseException:
            os.close(self.descriptor)
            self.descriptor = -1
            raise
        # Both ends find their way through large pages quicker. Where there are none, small ones do.
        _libc.madvise(self.address, size - size % _LARGE_PAGE, _MADV_COLLAPSE)
        fcntl.fcntl(self.descriptor, fcntl.F_ADD_SEALS, _REQUIRED)
        self.__array_interface__ = {"version": 3, "shape": (size,), "typestr": "|u1", "data": (self.address, False)}

    def __del__(self) -> None:
        if self.descriptor >= 0:
            # First: while it is unmapped other threads run, and their arrays may come to lie where it was.
            _memories.pop(self.address, None)
            _libc.munmap(self.address, self.size)
            os.close(self.descriptor)


def empty(shape: Union[int, Sequence[int]], dtype: Any = float, order: str = "C") -> numpy.typing.NDArray[Any]:
    """An array as `numpy.empty()` makes it, whose elements an engine of this machine sees where they are.

    As an argument of a call it is not sent, which is worth it from some MiB on, most of all when it is filled and sent
    many times. Parts of it that begin at a page count as well. What is smaller than 1 MiB, and all that goes to an
    engine without shared memory, travels like any other array.

    An argument must stay as it is until its call has ended. A function that keeps it for longer, or that forks, sees
    what is written later.

    >>> a = krutil.empty((1024, 1024))
    >>> a[:] = 1
    >>> with krutil.start() as session:
    ...     float(session.call("numpy.sum", a))
    1048576.0
    """
    # NumPy knows what a shape and a type are; this takes address space, and no memory.
    model: Any = numpy.empty(shape, dtype, order=order)  # type: ignore[call-overload]
    if model.nbytes < SMALLEST or model.dtype.hasobject:
        return model  # type: ignore[no-any-return]
    try:
        memory = _Memory(-(-model.nbytes // mmap.PAGESIZE) * mmap.PAGESIZE)
    except OSError as error:
        raise MemoryError(f"there is no shared memory for {model.nbytes} bytes: {error.strerror}") from None
    array: Any = numpy.ndarray(model.shape, model.dtype, numpy.asarray(memory), order="F" if model.flags.fnc else "C")
    _memories[memory.address] = weakref.ref(memory)
    return array  # type: ignore[no-any-return]


class Place:
    """Where the elements of an array lie in memory that an engine may map."""

    def __init__(self, memory: _Memory, offset: int, size: int) -> None:
        self.memory, self.offset, self.size = memory, offset, size

    @staticmethod
    def of(array: numpy.typing.NDArray[Any]) -> "Optional[Place]":
        """The place of elements that lie side by side, if it is one that a peer accepts."""
        size = array.nbytes
        if size < SMALLEST:
            return None
        address = array.__array_interface__["data"][0]
        for reference in list(_memories.values()):
            memory = reference()
            if memory is None:
                continue
            offset = address - memory.address
            if 0 <= offset <= memory.size - size and offset % mmap.PAGESIZE == 0:
                return Place(memory, offset, size)
        return None


class Lender:
    """What is lent to the peer of a session. Any thread may use it."""

    def __init__(self) -> None:
        self._numbers = itertools.count(1)
        self._lock = threading.Lock()
        self._lent: dict[int, _Memory] = {}

    def lend(self, place: Place) -> bytes:
        """The content of the frame that says where the elements are. They are lent from now on."""
        number = next(self._numbers)
        with self._lock:
            self._lent[number] = place.memory
        return _CONTENT.pack(number, place.offset, place.size)

    def take_back(self, number: int) -> None:
        """The peer has returned this content."""
        with self._lock:
            if self._lent.pop(number, None) is None:
                raise Violation(f"return frame: expected the number of a content that is lent, got {number}")


class _Borrowed:
    """Mapped memory of the peer, as what NumPy makes arrays of. It is returned when no array is left."""

    def __init__(self, address: int, size: int, give_back: Callable[[bool], object]) -> None:
        self.__array_interface__ = {"version": 3, "shape": (size,), "typestr": "|u1", "data": (address, False)}
        self._mapped = address, size
        self._give_back = give_back
        self._forks = _forks

    def __del__(self) -> None:
        _libc.munmap(*self._mapped)
        self._give_back(self._forks != _forks)


class Borrower:
    """What the peer of a session has lent. For the thread that reads; only `give_back` is called in any thread."""

    def __init__(self, descriptors: DescriptorQueue, give_back: Callable[[int, bool], object]) -> None:
        self._descriptors = descriptors
        self._give_back = give_back

    def borrow(self, content: Union[bytes, bytearray, memoryview], place: str) -> memoryview:
        """The bytes that the content of a shared data frame tells, where they are. `place` names the frame."""
        number, offset, size = _CONTENT.unpack(content)
        what = f"shared content of {place}"
        descriptor = self._descriptors.take()
        if descriptor is None:
            raise Violation(f"{what}: expected a descriptor, got none")
        try:
            if size < SMALLEST:
                raise Violation(f"{what}: expected {SMALLEST} bytes or more, got {size}")
            address = _map(descriptor, offset, size, what)
        finally:
            os.close(descriptor)
        give_back = self._give_back
        elements: Any = numpy.asarray(_Borrowed(address, size, lambda kept: give_back(number, kept)))
        return elements.data  # type: ignore[no-any-return]


def _map(descriptor: int, offset: int, size: int, what: str) -> int:
    """Maps memory that keeps to the rules. What is written to it stays in this process."""
    _check(descriptor, offset, size, what)
    try:
        return _map_at_large_page(descriptor, offset, size, mmap.MAP_PRIVATE | _MAP_NORESERVE)
    except OSError as error:
        raise Violation(f"{what}: expected memory that can be mapped, got {error.strerror}") from None


def _check(descriptor: int, offset: int, size: int, what: str) -> None:
    # The seals first: with them, nothing that is found out afterwards can change.
    system = (ctypes.c_long * 32)()
    try:
        seals = fcntl.fcntl(descriptor, fcntl.F_GET_SEALS)
        usual = _libc.fstatfs(descriptor, system) == 0 and system[0] == _TMPFS
        status = os.fstat(descriptor)
    except OSError:
        usual = False
    if not usual:
        raise Violation(f"{what}: expected a descriptor of anonymous memory, got one of another kind")
    if seals & _REQUIRED != _REQUIRED:
        raise Violation(f"{what}: expected the seals {_names(_REQUIRED)}, got {_names(seals)}")
    if size == 0 or offset % mmap.PAGESIZE:
        raise Violation(f"{what}: expected 1 byte or more from a multiple of {mmap.PAGESIZE} on, "
                        f"got {size} bytes from {offset} on")
    if offset + size > status.st_size:
        raise Violation(f"{what}: expected {size} bytes from {offset} on, got memory of {status.st_size} bytes")
    allocated = status.st_blocks * _BLOCK
    if allocated < status.st_size:
        raise Violation(f"{what}: expected {status.st_size} allocated bytes, got {allocated}")


def _names(seals: int) -> str:
    return ", ".join(name for seal, name in _SEALS.items() if seals & seal) or "none"


class Probe:
    """This end's part in trying whether descriptors arrive."""

    def __init__(self) -> None:
        self.token = os.urandom(8)
        self._memory: Optional[_Memory] = None
        try:
            self._memory = _Memory(mmap.PAGESIZE)
            ctypes.memmove(self._memory.address, self.token, 8)
        except OSError:
            pass  # Then no descriptor is sent, and the session goes without.

    def descriptors(self) -> list[int]:
        """What goes with the token."""
        return [self._memory.descriptor] if self._memory is not None else []

    @staticmethod
    def shows(descriptors: DescriptorQueue, token: Union[bytes, bytearray, memoryview]) -> bool:
        """Whether the memory of the other end has arrived, and is one that would be accepted."""
        arrived = descriptors.take_all()
        try:
            if len(arrived) != 1:
                return False
            address = _map(arrived[0], 0, len(token), "probe")
            shown = ctypes.string_at(address, len(token))
            _libc.munmap(address, len(token))
            return shown == bytes(token)
        except Violation:
            return False
        finally:
            for descriptor in arrived:
                os.close(descriptor)
