"""The event loop in which code of the session awaits. It lives as long as the session, so what one request makes with
await, the next can use."""

import asyncio
import atexit

_loop = None


def run_to_end(coroutine):
    """The value of a coroutine. Whatever interrupts it ends it first, with its finally clauses."""
    global _loop
    if asyncio._get_running_loop() is not None:
        coroutine.close()
        raise RuntimeError("await cannot be used at a prompt that holds up code of an event loop")
    if _loop is None or _loop.is_closed():
        _loop = asyncio.new_event_loop()
        atexit.register(_loop.close)
    task = _loop.create_task(coroutine)
    task.add_done_callback(lambda done: _loop.stop())
    try:
        _run(task)
    except BaseException:
        task.cancel()
        _run(task)
        if not task.cancelled():
            task.exception()  # it is known
        raise
    return task.result()


def _run(task):
    # Others may stop the loop as well.
    while not task.done():
        _loop.run_forever()
