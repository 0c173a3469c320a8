"""The Jupyter kernel of Python, as a front end uses it: the client library's own call, over its usual sockets."""

import contextlib
import time

from jupyter_client.manager import start_new_kernel


@contextlib.contextmanager
def evaluations():
    """A function that evaluates `1+1` so many times on a running kernel, and returns the seconds of one."""
    manager, client = start_new_kernel(kernel_name="python3")

    def evaluate(count):
        results = []

        def hook(message):
            if message["msg_type"] == "execute_result":
                results.append(message["content"]["data"]["text/plain"])

        begin = time.perf_counter()
        for _ in range(count):
            client.execute_interactive("1+1", store_history=False, output_hook=hook)
        seconds = (time.perf_counter() - begin) / count
        if results != ["2"] * count:
            raise RuntimeError(f"Jupyter: expected {count} times 2, got {results}")
        return seconds

    try:
        yield evaluate
    finally:
        client.stop_channels()
        manager.shutdown_kernel(now=True)
