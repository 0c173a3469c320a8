"""Engines in the workers of a real Dask cluster: a scheduler and two worker processes."""

import os
import signal
import tempfile
import unittest

import dask
import distributed
import numpy

import krutil
import krutil.dask
from eventually import PATIENCE, eventually

MODULE = """
import os, signal, time

def announce_and_wait(begun, path):
    open(begun + str(os.getpid()), "w").close()
    while not os.path.exists(path):
        time.sleep(0.005)
    return os.getpid()

def end():
    os.kill(os.getpid(), signal.SIGKILL)
"""


class ClusterTest(unittest.TestCase):
    def setUp(self):
        directory = tempfile.TemporaryDirectory()
        self.addCleanup(directory.cleanup)
        self.directory = directory.name
        with open(self.path("calls.py"), "w", encoding="utf-8") as file:
            file.write(MODULE)
        before = os.environ.get("PYTHONPATH", "")
        os.environ["PYTHONPATH"] = f"{self.directory}:{before}"
        self.addCleanup(os.environ.__setitem__, "PYTHONPATH", before)
        settings = dask.config.set({"distributed.comm.timeouts.connect": PATIENCE, "distributed.worker.daemon": False})
        settings.__enter__()
        self.addCleanup(settings.__exit__, None, None, None)
        cluster = distributed.LocalCluster(n_workers=2, threads_per_worker=1, processes=True, host="127.0.0.1",
                                           dashboard_address=None, local_directory=self.directory)
        self.addCleanup(cluster.close)
        self.client = distributed.Client(cluster)
        self.addCleanup(self.client.close)

    def path(self, name):
        return os.path.join(self.directory, name)

    def begun(self, begin="begun-"):
        return [int(name[len(begin):]) for name in os.listdir(self.directory) if name.startswith(begin)]

    def await_files(self, begin, count):
        eventually(lambda: len(self.begun(begin)) >= count, f"file number {count} of {begin}")

    def create(self, name):
        open(self.path(name), "w").close()

    def test_calls(self):
        with self.assertRaises(RuntimeError) as caught:
            self.client.submit(krutil.dask.call, "abs", -1).result(PATIENCE)
        self.assertEqual(str(caught.exception), "this worker has no engine: call "
                                                "client.register_worker_plugin(krutil.dask.Engine()) first")
        self.client.register_worker_plugin(krutil.dask.Engine())
        matrix = numpy.random.rand(100, 100)
        q, r = self.client.submit(krutil.dask.call, "numpy.linalg.qr", matrix, outputs=2).result(PATIENCE)
        self.assertTrue(numpy.allclose(q @ r, matrix))
        squares = self.client.gather(self.client.map(krutil.dask.call, ["numpy.square"] * 10, range(10)))
        self.assertEqual([int(each) for each in squares], [n * n for n in range(10)])
        with self.assertRaises(krutil.RemoteError) as caught:
            self.client.submit(krutil.dask.call, "int", "twelve").result(PATIENCE)
        self.assertEqual((caught.exception.identifier, caught.exception.message),
                         ("ValueError", "invalid literal for int() with base 10: 'twelve'"))

        # Each worker keeps one engine, beside the other's.
        waiting = [self.client.submit(krutil.dask.call, "calls.announce_and_wait", self.path("begun-"), self.path("go"),
                                      pure=False) for _ in range(2)]
        self.await_files("begun-", 2)
        self.create("go")
        engines = {int(each) for each in self.client.gather(waiting)}
        self.assertEqual(len(engines), 2)
        again = self.client.map(krutil.dask.call, ["os.getpid"] * 10, pure=False)
        self.assertLessEqual({int(each) for each in self.client.gather(again)}, engines)

        # A lost engine fails its own task, and is started again.
        with self.assertRaises(krutil.Lost) as caught:
            self.client.submit(krutil.dask.call, "calls.end", pure=False, workers=[self.worker()]).result(PATIENCE)
        self.assertTrue(str(caught.exception).startswith("the engine has gone (killed by signal 9): "))
        fresh = self.client.submit(krutil.dask.call, "os.getpid", pure=False, workers=[self.worker()]).result(PATIENCE)
        self.assertNotIn(int(fresh), engines)

    def worker(self):
        return sorted(self.client.scheduler_info()["workers"])[0]

    def test_a_worker_that_is_killed(self):
        self.client.register_worker_plugin(krutil.dask.Engine())
        worker = self.worker()
        task = self.client.submit(krutil.dask.call, "calls.announce_and_wait", self.path("begun-"), self.path("go"),
                                  pure=False, workers=[worker], allow_other_workers=True)
        self.await_files("begun-", 1)
        before, = self.begun()
        os.kill(self.parent(before), signal.SIGKILL)
        # Dask runs the task again, with the engine of another worker; the worker's own engine has gone with it.
        self.await_files("begun-", 2)
        self.create("go")
        self.assertNotEqual(int(task.result(PATIENCE)), before)
        eventually(lambda: not os.path.exists(f"/proc/{before}"), f"the end of process {before}")

    @staticmethod
    def parent(pid):
        with open(f"/proc/{pid}/stat", encoding="utf-8") as file:
            return int(file.read().rpartition(")")[2].split()[1])


if __name__ == "__main__":
    unittest.main()
