"""Memory of large contents that come in the stream: it is used again, but only when nobody refers to it."""

import gc
import threading
import unittest
from unittest import mock

import krutil
import numpy
from krutil import memory
from eventually import PATIENCE, eventually

MiB = 1 << 20


def kept():
    return [len(each) for each in memory._kept]


def address(view):
    return numpy.asarray(view).ctypes.data


class MemoryTest(unittest.TestCase):
    def setUp(self):
        memory._kept.clear()

    def test_it_is_handed_out_again_when_no_part_of_it_is_left(self):
        first = memory.memory_for(MiB)
        place, part = address(first), first[5:10]
        del first
        self.assertNotEqual(address(memory.memory_for(MiB)), place)
        self.assertEqual(kept(), [MiB])
        del part
        self.assertEqual(kept(), [MiB, MiB])
        held = memory.memory_for(MiB), memory.memory_for(MiB)
        self.assertIn(place, map(address, held))
        self.assertEqual(kept(), [])

    def test_another_size_has_memory_of_its_own(self):
        del (made := [memory.memory_for(MiB)])[:]
        made.append(memory.memory_for(MiB + 1))
        self.assertEqual((len(made[0]), kept()), (MiB + 1, [MiB]))

    def test_what_is_small_is_not_kept(self):
        self.assertEqual(len(memory.memory_for(MiB - 1)), MiB - 1)
        self.assertEqual(kept(), [])

    def test_what_is_kept_has_a_bound_and_the_oldest_goes(self):
        # Nothing is written to it, so it is address space.
        for size in (100, 50, 90, 60, 257, 256):
            memory.memory_for(size * MiB)
            self.assertLessEqual(sum(kept()), 256 * MiB)
            if size == 60:
                self.assertEqual(kept(), [50 * MiB, 90 * MiB, 60 * MiB])
            if size == 257:
                self.assertEqual(kept(), [50 * MiB, 90 * MiB, 60 * MiB])
        self.assertEqual(kept(), [256 * MiB])

    def test_the_system_may_take_the_pages_of_what_is_kept(self):
        def lazily_freed():
            with open("/proc/self/smaps_rollup") as file:
                return sum(int(line.split()[1]) for line in file if line.startswith("LazyFree:")) << 10

        view = memory.memory_for(32 * MiB)
        numpy.asarray(view).fill(1)
        self.assertLess(lazily_freed(), MiB)
        del view
        eventually(lambda: lazily_freed() > 24 * MiB, "pages that the system may take")

    def test_memory_that_there_is_not(self):
        for size in (1 << 60, 1 << 64):
            self.assertRaises(MemoryError, memory.memory_for, size)

    def test_threads_never_share_it(self):
        shared = []

        def take_turns(number):
            for turn in range(300):
                mine = numpy.asarray(memory.memory_for((1 + turn % 3) * MiB))
                mine[0], mine[-1] = number, number
                gc.collect(0)
                if (mine[0], mine[-1]) != (number, number):
                    shared.append(turn)

        threads = [threading.Thread(target=take_turns, args=(number,)) for number in range(8)]
        for thread in threads:
            thread.start()
        for thread in threads:
            thread.join(PATIENCE)
        self.assertEqual(shared, [])
        self.assertLessEqual(len(kept()), 24)


class EngineTest(unittest.TestCase):
    """With krutil-qvm, whose directory is the first in PATH."""

    def setUp(self):
        memory._kept.clear()

    def test_results_that_are_dropped_need_no_fresh_memory(self):
        with krutil.start("krutil-qvm --stdio --no-shared-memory") as session, \
                mock.patch.object(memory, "_fresh", side_effect=memory._fresh) as fresh:
            places = set()
            for n in range(5):
                result = session.call("numpy.full", MiB, float(n), timeout=PATIENCE)
                self.assertTrue((result == n).all())
                places.add(result.ctypes.data)
                del result
            self.assertEqual((len(places), fresh.call_count), (1, 1))

    def test_results_that_are_kept_stay_as_they_are(self):
        with krutil.start("krutil-qvm --stdio --no-shared-memory") as session:
            results = []
            for n in range(5):
                results.append(session.call("numpy.full", MiB, float(n), timeout=PATIENCE))
                session.call("numpy.full", MiB, -1.0, timeout=PATIENCE)
        for n, result in enumerate(results):
            self.assertTrue((result == n).all())


if __name__ == "__main__":
    unittest.main()
