"""Pools of the real engine. The directory of krutil-qvm is the first in PATH."""

import os
import stat
import tempfile
import threading
import unittest
import warnings
from concurrent.futures import CancelledError, wait

import krutil
import numpy
from eventually import PATIENCE, eventually

# Calls that tell which engine runs them, or end it.
MODULE = """
import os, signal, time

def wait_for(path):
    while not os.path.exists(path):
        time.sleep(0.005)
    return os.getpid()

def announce_and_wait(begun, path):
    open(begun + str(os.getpid()), "w").close()
    return wait_for(path)

def end():
    os.kill(os.getpid(), signal.SIGKILL)
"""


class PoolTest(unittest.TestCase):
    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.directory = directory.name
        with open(self.path("calls.py"), "w", encoding="utf-8") as file:
            file.write(MODULE)
        before = os.environ.get("PYTHONPATH", "")
        os.environ["PYTHONPATH"] = f"{self.directory}:{before}"
        self.addCleanup(os.environ.__setitem__, "PYTHONPATH", before)

    def path(self, name):
        return os.path.join(self.directory, name)

    def create(self, name):
        open(self.path(name), "w").close()

    def test_calls(self):
        with krutil.Pool(2) as pool:
            matrix = numpy.random.rand(50, 50)
            q, r = pool.submit("numpy.linalg.qr", matrix, outputs=2).result(PATIENCE)
            self.assertTrue(numpy.allclose(q @ r, matrix))
            self.assertIsNone(pool.submit("os.getpid", outputs=0).result(PATIENCE))
            self.assertEqual([int(each) for each in pool.map("pow", range(20), [2] * 20, timeout=PATIENCE)],
                             [n * n for n in range(20)])
            with self.assertRaises(krutil.RemoteError) as caught:
                pool.submit("int", "twelve").result(PATIENCE)
            self.assertEqual(caught.exception.identifier, "ValueError")
            with self.assertRaises(TypeError) as caught:
                pool.submit(numpy.linalg.inv, matrix)
            self.assertEqual(str(caught.exception), "function: expected the name of a function of the engine, such as "
                                                    "'numpy.linalg.inv'; got function")
            with self.assertRaises(TypeError):
                pool.submit("len", object()).result(PATIENCE)

    def test_engines_work_side_by_side(self):
        with krutil.Pool(3) as pool:
            waiting = [pool.submit("calls.announce_and_wait", self.path("begun-"), self.path("go")) for _ in range(3)]
            self.await_files("begun-", 3)
            self.create("go")
            self.assertEqual(len({int(each.result(PATIENCE)) for each in waiting}), 3)

    def await_files(self, begin, count):
        eventually(lambda: sum(name.startswith(begin) for name in os.listdir(self.directory)) >= count,
                   f"file number {count} of {begin}")

    def test_a_lost_engine_fails_its_own_call_only(self):
        with krutil.Pool(2) as pool:
            held = pool.submit("calls.announce_and_wait", self.path("begun-"), self.path("go"))
            self.await_files("begun-", 1)
            calls = [pool.submit("calls.end"), *(pool.submit("operator.neg", n) for n in range(5))]
            with self.assertRaises(krutil.Lost) as caught:
                calls[0].result(PATIENCE)
            self.assertTrue(str(caught.exception).startswith("the engine has gone (killed by signal 9): "))
            # The engine that was held runs none of these: the one that was lost has been started again.
            self.assertEqual([int(call.result(PATIENCE)) for call in calls[1:]], [0, -1, -2, -3, -4])
            self.assertFalse(held.done())
            self.create("go")
            held.result(PATIENCE)

    def test_no_call_is_made_twice(self):
        with krutil.Pool(1) as pool:
            with self.assertRaises(krutil.Lost):
                pool.submit("os.abort").result(PATIENCE)
            # One file for each process that has run this.
            self.create("go")
            pool.submit("calls.announce_and_wait", self.path("begun-"), self.path("go")).result(PATIENCE)
        self.assertEqual(sum(name.startswith("begun-") for name in os.listdir(self.directory)), 1)

    def test_an_engine_that_ends_while_it_has_nothing_to_do(self):
        with krutil.Pool(1) as pool:
            before = int(pool.submit("os.getpid").result(PATIENCE))
            os.kill(before, 9)
            # The call after that finds the engine lost or a new one; whichever comes, the next one has an engine.
            wait([pool.submit("os.getpid")], PATIENCE)
            self.assertNotEqual(int(pool.submit("os.getpid").result(PATIENCE)), before)

    def script(self, name, text):
        path = self.path(name)
        with open(path, "w", encoding="utf-8") as file:
            file.write(f"#!/bin/sh\n{text}\n")
        os.chmod(path, stat.S_IRWXU)
        return path

    def test_commands(self):
        once = self.script("once", 'exec krutil-qvm --stdio')
        with krutil.Pool([once, ["krutil-qvm", "--stdio"]]) as pool:
            self.assertEqual(int(pool.submit("abs", -1).result(PATIENCE)), 1)

    def test_an_engine_that_cannot_be_started(self):
        with self.assertRaises(FileNotFoundError):
            krutil.Pool(["krutil-qvm --stdio", self.path("nothing")])
        with self.assertRaises(krutil.Lost) as caught:
            krutil.Pool(["krutil-qvm --stdio", self.script("fails", "exit 3")])
        self.assertEqual(str(caught.exception), "the engine has gone (exit code 3) before it said anything")
        with self.assertRaises(ValueError) as caught:
            krutil.Pool(0)
        self.assertEqual(str(caught.exception), "a pool needs one engine or more")
        with self.assertRaises(TypeError) as caught:
            krutil.Pool("krutil-qvm --stdio")
        self.assertEqual(str(caught.exception), "engines: expected a number or a list of commands, got a str; for one "
                                                "engine: ['krutil-qvm --stdio']")

    def test_an_engine_that_cannot_be_started_again(self):
        # The script runs an engine as often as there are files to take away.
        script = self.script("twice", f'rm "{self.path("ticket")}" 2>/dev/null && exec krutil-qvm --stdio')
        self.create("ticket")
        with krutil.Pool([script, "krutil-qvm --stdio"]) as pool, warnings.catch_warnings(record=True) as told:
            warnings.simplefilter("always")
            held = [pool.submit("calls.announce_and_wait", self.path("begun-"), self.path("go")) for _ in range(2)]
            self.await_files("begun-", 2)
            for name in os.listdir(self.directory):
                if name.startswith("begun-"):
                    os.kill(int(name.rpartition("-")[2]), 9)
            for call in held:
                self.assertRaises(krutil.Lost, call.result, PATIENCE)
            # One engine is left, and does all of it.
            self.create("go")
            pids = {int(pool.submit("calls.wait_for", self.path("go")).result(PATIENCE)) for _ in range(10)}
            self.assertEqual(len(pids), 1)
            self.await_warning(pool, told)
            # What has been the only one is lost as well; but its command works.
            self.assertRaises(krutil.Lost, pool.submit("calls.end").result, PATIENCE)
            self.assertEqual(int(pool.submit("abs", -1).result(PATIENCE)), 1)

    def await_warning(self, pool, told):
        """The engine is found missing when its thread takes a call, and either thread may take one."""
        def look():
            pool.submit("abs", 1).result(PATIENCE)
            return told

        eventually(look, "the warning")
        self.assertTrue(str(told[0].message).startswith("an engine of the pool cannot be started again: the engine has gone"))

    def test_no_engine_is_left(self):
        self.create("ticket")
        script = self.script("once", f'rm "{self.path("ticket")}" 2>/dev/null && exec krutil-qvm --stdio')
        with krutil.Pool([script]) as pool, warnings.catch_warnings():
            warnings.simplefilter("ignore")
            calls = [pool.submit("calls.end"), pool.submit("abs", 1), pool.submit("abs", 2)]
            self.assertRaises(krutil.Lost, calls[0].result, PATIENCE)
            for call in (*calls[1:], pool.submit("abs", 3)):
                with self.assertRaises(krutil.Lost) as caught:
                    call.result(PATIENCE)
                self.assertTrue(str(caught.exception).startswith("no engine of the pool can be started again: "))

    def test_the_end(self):
        pool = krutil.Pool(1)
        held = pool.submit("calls.announce_and_wait", self.path("begun-"), self.path("go"))
        self.await_files("begun-", 1)
        waiting = pool.submit("abs", 1)
        pool.shutdown(wait=False, cancel_futures=True)
        self.assertRaises(CancelledError, waiting.result, PATIENCE)
        with self.assertRaises(RuntimeError) as caught:
            pool.submit("abs", 1)
        self.assertEqual(str(caught.exception), "the pool is shut down")
        self.create("go")
        pid = int(held.result(PATIENCE))
        pool.shutdown()
        self.assertFalse(os.path.exists(f"/proc/{pid}"))
        self.assertFalse([thread for thread in threading.enumerate() if thread.name.startswith("krutil")])

    def test_a_call_that_waits_can_be_cancelled(self):
        with krutil.Pool(1) as pool:
            held = pool.submit("calls.announce_and_wait", self.path("begun-"), self.path("go"))
            self.await_files("begun-", 1)
            waiting = pool.submit("calls.announce_and_wait", self.path("other-"), self.path("go"))
            self.assertTrue(waiting.cancel())
            self.assertFalse(held.cancel())
            self.create("go")
            held.result(PATIENCE)
        self.assertFalse([name for name in os.listdir(self.directory) if name.startswith("other-")])


if __name__ == "__main__":
    unittest.main()
