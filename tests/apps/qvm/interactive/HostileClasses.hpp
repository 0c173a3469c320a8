// Python classes that tell whether anything of theirs ran.
#pragma once

namespace qvm_test {

/// Each hook of these classes adds its name to the list `ran`, and raises an error.
inline constexpr char hostileClasses[] = R"(
ran = []
def note(name):
    def hook(*arguments, **options):
        if armed:
            ran.append(name)
        raise ValueError(name)
    return hook
armed = False
hooks = ['__getattr__', '__getattribute__', '__dir__', '__eq__', '__ne__', '__lt__', '__hash__', '__len__', '__iter__',
         '__contains__', '__getitem__', '__repr__', '__str__', '__bool__', '__index__', '__call__', '__get__', '__set__',
         '__delete__', '__instancecheck__', '__subclasscheck__', '__format__', '__length_hint__', 'keys', 'items', 'mro']
class Meta(type):
    pass
class Hostile(metaclass=Meta):
    prop = property(note('property'))
    @classmethod
    def bound(cls, parameter): pass
    def method(self, parameter): pass
class HostileDict(dict): pass
class HostileList(list): pass
class HostileText(str): pass
class HostileDescriptor: pass
class Slots:
    __slots__ = 'inside',
plain = Slots()
Hostile.descriptor = HostileDescriptor()
thing = Hostile()
thing.own = thing
plain.inside = thing
mapping, row, text = HostileDict(key=1), HostileList([1]), HostileText('key')
class Equal(str):
    def __hash__(self): return hash(str.__str__(self))
inner = {Equal('key'): thing, 'other': thing, 'key' : [thing]}
thing.__dict__[Equal('own2')] = 1
globals()[Equal('thang')] = thing
Equal.__eq__ = note('__eq__ of a key')
Equal.__hash__ = note('__hash__ of a key')
def wrapped(parameter): pass
wrapped.__signature__ = thing
wrapped.__text_signature__ = thing
wrapped.__wrapped__ = thing
wrapped.__doc__ = thing
class Shadowed:
    __dict__ = property(note('__dict__'))
    __class__ = property(note('__class__'))
    __doc__ = property(note('__doc__'))
    __slots__ = ()
shadowed = Shadowed()
for name in hooks:
    if name != 'mro':
        for kind in Hostile, HostileDict, HostileList, HostileText, HostileDescriptor:
            if name not in ('__get__', '__set__', '__delete__') or kind is HostileDescriptor:
                type.__setattr__(kind, name, note(name))
for name in hooks:
    type.__setattr__(Meta, name, note('Meta.' + name))
armed = True
)";

}  // namespace qvm_test
