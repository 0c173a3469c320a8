"""Waiting for what nothing tells of, in tests of Python code."""

import time

# Longer than anything takes that ends at all, on a machine with other work and with a sanitizer's engine.
PATIENCE = 120


def eventually(look, what="it"):
    """Looks again and again until look() returns something true, which is returned. Fails when a test's patience is at
    its end: what did not come."""
    end = time.monotonic() + PATIENCE
    while not (found := look()):
        if time.monotonic() > end:
            raise AssertionError(f"{what} did not come within {PATIENCE} seconds")
        time.sleep(0.005)
    return found
