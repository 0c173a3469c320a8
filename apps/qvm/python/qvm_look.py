"""Looks at objects and runs none of their code.

Attribute access, isinstance(), dict lookups and dir() may all call functions of a class. So classes are taken from
type(), their namespaces from the descriptors of type itself, and names are compared only where they are plain text.
"""

import sys
from itertools import islice
from types import (BuiltinFunctionType, ClassMethodDescriptorType, FunctionType, GetSetDescriptorType, MappingProxyType,
                   MemberDescriptorType, MethodDescriptorType, MethodType, MethodWrapperType, ModuleType,
                   WrapperDescriptorType)

# What a look-up gives where there is nothing, or nothing that can be had without running code.
ABSENT = object()

# No more entries of one namespace are looked at.
MAX_ENTRIES = 100_000

C_FUNCTIONS = BuiltinFunctionType, MethodDescriptorType, MethodWrapperType, WrapperDescriptorType

_mro = type.__dict__["__mro__"].__get__
_class_names = type.__dict__["__dict__"].__get__
_text_signature = type.__dict__["__text_signature__"].__get__

# Attributes that NumPy's own code computes from an array.
_ARRAY_ATTRIBUTES = ("T", "dtype", "flags", "itemsize", "nbytes", "ndim", "shape", "size", "strides")


def is_class(thing):
    return issubclass(type(thing), type)


def is_one_of(thing, *kinds):
    """Whether the type of the thing is one of these. Comparing types by == would ask their metaclass."""
    return any(type(thing) is kind for kind in kinds)


def entries(names):
    """Names and values of a namespace, of those names that are plain text."""
    if issubclass(type(names), dict):
        items = dict.items(names)
    elif type(names) is MappingProxyType:
        items = names.items()
    else:
        return []
    return [item for item in islice(items, MAX_ENTRIES) if type(item[0]) is str]


def look_up(names, name):
    """The value of a name in a namespace."""
    return next((value for each, value in entries(names) if each == name), ABSENT)


def class_attribute(kind, name):
    """What the class or a base of it has under the name, as it stands there."""
    for each in _mro(kind):
        found = look_up(_class_names(each), name)
        if found is not ABSENT:
            return found
    return ABSENT


def own_names(thing):
    """The namespace of an instance; an empty one where it has none."""
    slot = class_attribute(type(thing), "__dict__")
    if not is_one_of(slot, GetSetDescriptorType, MemberDescriptorType):
        return {}
    try:
        names = slot.__get__(thing)
    except (AttributeError, TypeError):
        return {}
    return names if issubclass(type(names), dict) else {}


def attribute_names(thing):
    """Names that the instance and its classes define; for a class, what it and its bases define."""
    kind = thing if is_class(thing) else type(thing)
    names = {name for each in _mro(kind) for name, value in entries(_class_names(each))}
    if kind is not thing:
        names.update(name for name, value in entries(own_names(thing)))
    if is_exactly(thing, "numpy", "recarray"):
        names.update(field_names(thing))
    names.update(name for name in column_names(thing) if name.isidentifier())
    return names


def attribute(thing, name):
    """The value of an attribute, where no code of the object's is needed to get it."""
    kind = type(thing)
    if type(class_attribute(kind, "__getattribute__")) is not WrapperDescriptorType:
        return ABSENT
    if name in _ARRAY_ATTRIBUTES and is_exactly(thing, "numpy", "ndarray"):
        return getattr(thing, name)
    found = class_attribute(kind, name)
    if _has(found, "__set__") or _has(found, "__delete__"):
        return _slot(found, thing)
    own = class_attribute(thing, name) if is_class(thing) else look_up(own_names(thing), name)
    if own is not ABSENT:
        return _of_class(own, thing) if is_class(thing) else own
    return _of_instance(found, thing)


def item(thing, key):
    """What a list, tuple or dict has under a key that is a plain number or text; no other type is asked."""
    if is_one_of(thing, list, tuple):
        return thing[key] if type(key) is int and -len(thing) <= key < len(thing) else ABSENT
    if type(thing) is dict:
        return next((value for each, value in islice(thing.items(), MAX_ENTRIES)
                     if type(each) is type(key) and each == key), ABSENT)
    return ABSENT


def is_exactly(thing, module, name):
    """Whether the type of the thing is that one of a module that is loaded; subclasses are of the user."""
    loaded = look_up(sys.modules, module)
    return type(loaded) is ModuleType and look_up(own_names(loaded), name) is type(thing)


def field_names(array):
    """Names of the fields of a NumPy array."""
    return [name for name in array.dtype.names or () if type(name) is str]


def column_names(thing):
    """Names of the columns of a data frame of pandas; none for anything else. Labels are only taken from where they are
    when pandas and NumPy keep them, because an index and an array of the user's own have code of their own."""
    if not is_exactly(thing, "pandas", "DataFrame"):
        return []
    index = thing.columns
    labels = index.values if is_exactly(index, "pandas", "Index") else None
    if not is_exactly(labels, "numpy", "ndarray"):
        return []
    return [name for name in labels[:MAX_ENTRIES].tolist() if type(name) is str]


def _has(descriptor, method):
    return descriptor is not ABSENT and class_attribute(type(descriptor), method) is not ABSENT


def _slot(descriptor, thing):
    if type(descriptor) is not MemberDescriptorType:
        return ABSENT
    try:
        return descriptor.__get__(thing)
    except (AttributeError, TypeError):
        return ABSENT


def _of_instance(found, thing):
    """What an attribute of the class is to an instance."""
    if type(found) is staticmethod:
        return found.__func__
    if type(found) is classmethod:
        return _bound(found.__func__, type(thing))
    if type(found) is FunctionType:
        return MethodType(found, thing)
    if is_one_of(found, MethodDescriptorType, WrapperDescriptorType):
        return found.__get__(thing)
    return ABSENT if _has(found, "__get__") else found


def _of_class(found, thing):
    """What an attribute of the class is to the class itself."""
    if type(found) is staticmethod:
        return found.__func__
    if type(found) is classmethod:
        return _bound(found.__func__, thing)
    if type(found) is ClassMethodDescriptorType:
        return found.__get__(None, thing)
    if is_one_of(found, FunctionType, MethodDescriptorType, WrapperDescriptorType):
        return found
    return ABSENT if _has(found, "__get__") else found


def _bound(function, thing):
    return MethodType(function, thing) if type(function) is FunctionType else ABSENT


def function_of(thing):
    """The Python function that a call of the thing runs first, and how many of its parameters the call fills in by
    itself. None for functions that are not of Python."""
    filled = 0
    for _ in range(100):
        if type(thing) is MethodType:
            thing, filled = thing.__func__, filled + 1
        elif type(thing) is FunctionType:
            wrapped = look_up(thing.__dict__, "__wrapped__")
            if wrapped is ABSENT:
                return thing, filled
            thing = wrapped
        elif is_class(thing):
            made = class_attribute(thing, "__init__")
            if type(made) is not FunctionType:
                made = class_attribute(thing, "__new__")
                made = made.__func__ if type(made) is staticmethod else made
            if type(made) is not FunctionType:
                return None
            thing, filled = made, filled + 1
        else:
            called = class_attribute(type(thing), "__call__")
            if type(called) is not FunctionType:
                return None
            thing, filled = called, filled + 1
    return None


def text_signature(thing):
    """The parameters of a function or a class that is not of Python, as its code states them; None where it does not.
    One that a call fills in by itself has a dollar sign."""
    text = thing.__text_signature__ if is_one_of(thing, *C_FUNCTIONS) else None
    if is_class(thing):
        text = _text_signature(thing)
    return text if type(text) is str else None
