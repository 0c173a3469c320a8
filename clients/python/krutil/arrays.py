"""NumPy arrays in messages, and back, without copying the elements of large ones."""

import functools
from typing import Any, Union

import numpy
import numpy.typing

from .schema import Array
from .shared import Place
from .wire import ARRAY_TAG, Frame, Message

#: What a function returns: an array, or text.
Value = Union[numpy.typing.NDArray[Any], str]

_ROW_MAJOR, _COLUMN_MAJOR = 1, 2
_TEXT = 2
_BOOL = 1
# Elements of this many bytes or more travel in a frame of their own, where both ends have agreed on that.
_DATA_FRAME_FROM = 2_048
_MOST_DIMENSIONS = 32


def _complex_integer(part: str) -> "numpy.dtype[Any]":
    return numpy.dtype([("real", part), ("imag", part)])


# Code of an element -> its type here.
_DTYPES = {
    _BOOL: numpy.dtype("?"), _TEXT: numpy.dtype("<u2"), 4: numpy.dtype("<f4"), 5: numpy.dtype("<f8"),
    6: numpy.dtype("i1"), 7: numpy.dtype("u1"), 8: numpy.dtype("<i2"), 9: numpy.dtype("<u2"),
    10: numpy.dtype("<i4"), 11: numpy.dtype("<u4"), 12: numpy.dtype("<i8"), 13: numpy.dtype("<u8"),
    14: numpy.dtype("<c8"), 15: numpy.dtype("<c16"),
    16: _complex_integer("i1"), 17: _complex_integer("u1"), 18: _complex_integer("<i2"), 19: _complex_integer("<u2"),
    20: _complex_integer("<i4"), 21: _complex_integer("<u4"), 22: _complex_integer("<i8"), 23: _complex_integer("<u8"),
}
_CODES = {dtype: code for code, dtype in _DTYPES.items() if code != _TEXT}
# Code of an element -> type byte of its data frame.
_FRAME_TYPES = {1: 13, 2: 14, 4: 12, 5: 11, 6: 3, 7: 4, 8: 5, 9: 6, 10: 7, 11: 8, 12: 9, 13: 10, 14: 16, 15: 15,
                16: 17, 17: 18, 18: 19, 19: 20, 20: 21, 21: 22, 22: 23, 23: 24}


def add_argument(frames: list[Frame], value: Any, zero_copy: bool) -> int:
    """Appends the frames of an argument to a message, and returns the index of its array.

    The elements of a large array are not copied if they lie side by side: the frame shows the array's own memory. So
    the array must stay as it is until the message is sent. What is no array of a known type is a `TypeError`.
    """
    if isinstance(value, str):
        units = numpy.frombuffer(value.encode("utf-16-le", "surrogatepass"), "<u2")
        array, code = units.reshape(1, units.size), _TEXT
    else:
        array, code = _sendable(value)
    if not (array.flags.c_contiguous or array.flags.f_contiguous):
        array = numpy.ascontiguousarray(array)
    order = _ROW_MAJOR if array.flags.c_contiguous else _COLUMN_MAJOR
    elements = numpy.ndarray(array.nbytes, numpy.uint8, array if order == _ROW_MAJOR else array.T).data
    if zero_copy and elements.nbytes >= _DATA_FRAME_FROM:
        frames.append(Frame(None, _FRAME_TYPES[code], elements, Place.of(array)))
        description = _of_data_frame(code, array.shape, order, len(frames))
    else:
        description = Array(elementType=code, dimensions=array.shape, order=order,
                            inlineElements=bytes(elements)).SerializeToString()
    frames.append(Frame(ARRAY_TAG, 29, description))
    return len(frames)


@functools.lru_cache(maxsize=64)
def _of_data_frame(code: int, shape: tuple[int, ...], order: int, index: int) -> bytes:
    """The description of an array whose elements are in another frame. Calls in a loop send the same one each time."""
    made: bytes = Array(elementType=code, dimensions=shape, order=order, dataID=index).SerializeToString()
    return made


def _sendable(value: Any) -> "tuple[numpy.typing.NDArray[Any], int]":
    """The value as an array whose elements are as they are sent, and their code."""
    # Nearly always it is one. Each step to find that out is slow after a large array, which leaves no code in the caches.
    code = _CODES.get(value.dtype) if type(value) is numpy.ndarray else None
    if code is not None:
        return value, code
    if isinstance(value, numpy.ma.MaskedArray):
        raise TypeError("argument: a masked array would lose its mask; use its data, or filled()")
    array = numpy.asarray(value)
    array = array.astype(array.dtype.newbyteorder("<"), copy=False)
    code = _CODES.get(array.dtype)
    if code is None:
        raise TypeError(f"argument: expected an array of bool, of integers of 8 to 64 bits, of single, double or "
                        f"complex numbers, or a str; got {type(value).__name__} with elements of {array.dtype}")
    return array, code


def take_value(message: Message, index: int, zero_copy: bool) -> Value:
    """The array at this index of a message. A large one keeps the memory into which it was received."""
    description = message.take(index, {ARRAY_TAG: Array})[1]
    dtype = _DTYPES.get(description.elementType)
    if dtype is None:
        raise message.unreadable(f"Array: elements of type {description.elementType} are not known")
    if description.order not in (_ROW_MAJOR, _COLUMN_MAJOR):
        raise message.unreadable("Array: expected the order 1 (row major) or 2 (column major), "
                                 f"got {description.order}")
    shape = tuple(description.dimensions)
    if len(shape) > _MOST_DIMENSIONS:
        raise message.unreadable(f"Array: expected at most {_MOST_DIMENSIONS} dimensions, got {len(shape)}")
    which = description.WhichOneof("elements")
    if which == "inlineElements":
        elements: Any = bytearray(description.inlineElements)
    elif which == "dataID" and zero_copy:
        elements = message.take_data(description.dataID)
    else:
        raise message.unreadable("Array: a data ID while zero copy is off" if which else "Array: there are no elements")
    # Python's integers have no largest one, so the product is what it is.
    size = dtype.itemsize
    for extent in shape:
        size *= extent
    if size != len(elements):
        raise message.unreadable(f"Array: expected {size} bytes of elements for {list(shape)}, got {len(elements)}")
    try:
        array: Any = numpy.ndarray(shape, dtype, elements, order="C" if description.order == _ROW_MAJOR else "F")
    except (ValueError, OverflowError):  # an array without elements, but with an extent that NumPy cannot have
        raise message.unreadable(f"Array: no array has the dimensions {list(shape)}") from None
    if description.elementType == _BOOL and array.size and array.view(numpy.uint8).max() > 1:
        raise message.unreadable("Array: expected 0 or 1 as an element of type bool")
    if description.elementType == _TEXT and sum(extent != 1 for extent in shape) <= 1:
        return bytes(elements).decode("utf-16-le", "replace")
    return array  # type: ignore[no-any-return]
