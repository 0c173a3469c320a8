"""Calls in engines, one for each worker of a Dask cluster: Dask places and schedules them.

It needs Dask's distributed (`apt-get install python3-distributed`), which nothing else of this package needs.

    from dask.distributed import Client
    import krutil.dask

    client = Client("scheduler:8786")
    client.register_worker_plugin(krutil.dask.Engine())
    q_and_r = client.submit(krutil.dask.call, "numpy.linalg.qr", matrix, outputs=2)

The workers need this package, and `krutil-qvm` in their PATH or by the command that is given.
"""

import threading
from typing import Any, Optional

from distributed import Worker, WorkerPlugin, get_worker

from .errors import Error
from .session import Command, Session, start

_NAME = "krutil"
# What an engine has for its exit functions, in seconds.
_SHUTDOWN = 3.0


class Engine(WorkerPlugin):
    """Keeps one engine for each worker, which begins with the first call there and ends with the worker."""

    #: By which Dask knows the plugin: a worker has one at most.
    name = _NAME

    def __init__(self, command: Optional[Command] = None, *, timeout: float = 60) -> None:
        """`command` and `timeout` are those of `krutil.start()`."""
        self._command = command
        self._timeout = timeout

    def setup(self, worker: Worker) -> None:
        """Called by Dask, in each worker, on a copy of its own."""
        self._lock = threading.Lock()
        self._session: Optional[Session] = None

    def teardown(self, worker: Worker) -> None:
        """Called by Dask when the worker ends."""
        with self._lock:
            if self._session is not None:
                try:
                    self._session.close(_SHUTDOWN)
                except (Error, TimeoutError):
                    pass  # It has gone already, or a call still runs.
                self._session.kill()

    def session(self) -> Session:
        """The session with this worker's engine, which is started if there is none."""
        with self._lock:
            if self._session is not None and self._session.ended:
                self._session.kill()
                self._session = None
            if self._session is None:
                self._session = start(self._command, timeout=self._timeout)
            return self._session


def call(function: str, *arguments: Any, outputs: int = 1) -> Any:
    """Calls a function in the engine of the worker that runs this, as `krutil.Session.call()` does.

    A task of Dask: `client.submit(krutil.dask.call, "numpy.linalg.inv", x)`, or `client.map` with it. Dask takes tasks
    with equal arguments for one; with `pure=False` they are not. When the engine is lost, the task fails with
    `krutil.Lost`, and the next one here begins with a new engine. When the worker is lost, Dask runs its tasks again on
    another one, unless it is told otherwise.
    """
    plugin = get_worker().plugins.get(_NAME)
    if not isinstance(plugin, Engine):
        raise RuntimeError("this worker has no engine: call client.register_worker_plugin(krutil.dask.Engine()) first")
    return plugin.session().call(function, *arguments, outputs=outputs)
