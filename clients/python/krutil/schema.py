"""The message classes of the protocol, made from the descriptors that lie beside this file.

They live in a descriptor pool of their own. So the package can be loaded into a process that has other classes of the
same names, such as one that is linked with the C++ library.
"""

import os
from typing import Any

from google.protobuf import descriptor_pb2, descriptor_pool, message_factory


def _load() -> descriptor_pool.DescriptorPool:
    path = os.path.join(os.path.dirname(os.path.abspath(__file__)), "schema.bin")
    with open(path, "rb") as file:
        files = descriptor_pb2.FileDescriptorSet.FromString(file.read()).file
    pool = descriptor_pool.DescriptorPool()
    for each in files:
        pool.Add(each)
    return pool


_pool = _load()
# Newer versions of protobuf have a function in place of the factory.
_class_of = getattr(message_factory, "GetMessageClass", None) or message_factory.MessageFactory(_pool).GetPrototype


def _message(name: str) -> Any:
    return _class_of(_pool.FindMessageTypeByName(name))


def _numbers(name: str) -> dict[str, int]:
    return {value.name: value.number for value in _pool.FindEnumTypeByName(name).values}


SessionHello = _message("msg_svc.protobuf.SessionHello")
SessionVerdict = _message("msg_svc.protobuf.SessionVerdict")

IIPEnqueueMessage = _message("krutil.protobuf.IIPEnqueueMessage")
IIPCancelMessage = _message("krutil.protobuf.IIPCancelMessage")
EvalIIP = _message("krutil.protobuf.EvalIIP")
FEvalIIP = _message("krutil.protobuf.FEvalIIP")
Array = _message("foundation.korveldata.protobuf.KORVEL_Array")

IIPReply = _message("krutil.protobuf.IIPReply")
IIPCancelReply = _message("krutil.protobuf.IIPCancelReply")
IIPResult = _message("krutil.protobuf.IIPResult")
FEvalResult = _message("krutil.protobuf.FEvalResult")

TextBaseEvent = _message("krutil.protobuf.TextBaseEvent")
SinkTextEvent = _message("krutil.protobuf.SinkTextEvent")
DebugLoopEvent = _message("krutil.protobuf.DebugLoopEvent")
IssuedEnabledWarningEvent = _message("krutil.protobuf.IssuedEnabledWarningEvent")
PrintableErrorEvent = _message("krutil.protobuf.PrintableErrorEvent")

CodeType = _numbers("krutil.protobuf.CodeType")
WhenToDequeue = _numbers("krutil.protobuf.WhenToDequeue")
InputRequester = _numbers("krutil.protobuf.InputRequester")
ExecutionStatus = _numbers("krutil.protobuf.ExecutionStatus")
