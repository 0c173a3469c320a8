"""The client for asyncio, with the real engine."""

import asyncio
import tempfile
import threading
import unittest

import krutil
import numpy
from engine_test import set_zero_copy
from eventually import PATIENCE
from scripted import DONE, GREETING, SHUTDOWN, ScriptedEngine, message


class AioTest(unittest.IsolatedAsyncioTestCase):
    def setUp(self):
        set_zero_copy(self, True)

    def begin(self, **options):
        return krutil.aio.start(timeout=PATIENCE, **options)

    async def test_eval_and_call(self):
        async with self.begin() as session:
            self.assertEqual(await session.eval("print('one'); 2", timeout=PATIENCE), krutil.Result("one\n", "2", ()))
            q, r = await session.call("numpy.linalg.qr", numpy.eye(100), outputs=2, timeout=PATIENCE)
            self.assertTrue(numpy.allclose(q @ r, numpy.eye(100)))
            with self.assertRaises(krutil.RemoteError) as caught:
                await session.eval("1 / 0", timeout=PATIENCE)
            self.assertEqual(caught.exception.identifier, "ZeroDivisionError")

    async def test_text_comes_in_the_event_loop(self):
        async def eval_in_task():
            await session.eval("print('one')", on_text=lambda text: seen.append((str(text), asyncio.current_task())),
                               timeout=PATIENCE)

        seen = []
        async with self.begin() as session:
            task = asyncio.create_task(eval_in_task())
            await task
        self.assertEqual("".join(text for text, _ in seen), "one\n")
        self.assertEqual({where for _, where in seen}, {task})

    async def test_sessions_at_a_time(self):
        async def ask(number):
            async with self.begin() as session:
                return (await session.eval(f"{number} * 2", timeout=PATIENCE)).value

        self.assertEqual(await asyncio.gather(*map(ask, range(3))), ["0", "2", "4"])

    async def test_events_and_cancel(self):
        async with self.begin() as session:
            request = session.submit("while True: pass")
            seen = []
            async for event in request.events():
                seen.append(str(event))
                if event == "started":
                    self.assertEqual(await request.cancel(even_if_running=False), krutil.CancelAnswer.ALREADY_RUNNING)
                    self.assertEqual(await request.cancel(), krutil.CancelAnswer.PENDING)
            self.assertEqual(seen, ["started", "completed", "last"])
            with self.assertRaises(krutil.Cancelled):
                await request
            self.assertTrue(request.done())
            self.assertEqual([str(event) async for event in request.events()], seen)

    async def test_a_file_is_run(self):
        with tempfile.NamedTemporaryFile("w", suffix=".py") as file:
            print("import sys\nprint(__file__, sys.argv[1:])", file=file, flush=True)
            async with krutil.aio.start() as session:
                result = await session.run(file.name, "first", timeout=PATIENCE)
                self.assertEqual(result, krutil.Result(f"{file.name} ['first']\n", None, ()))

    async def test_cancelling_the_task_cancels_the_request(self):
        async with self.begin() as session:
            running = asyncio.Event()
            task = asyncio.create_task(session.eval("print('go')\nwhile True: pass", on_text=lambda text: running.set()))
            await running.wait()
            task.cancel()
            with self.assertRaises(asyncio.CancelledError):
                await task
            self.assertEqual((await session.eval("'goes on'", timeout=PATIENCE)).value, "'goes on'")

    async def test_cancelling_a_task_that_waits_for_a_request_leaves_it_alone(self):
        released = threading.Event()

        def answer(text):
            self.assertTrue(released.wait(PATIENCE))
            return "line"

        async with self.begin(on_input=answer) as session:
            request = session.submit("input()")
            task = asyncio.create_task(request.result())
            async for event in request.events():
                if event == "suspended":
                    task.cancel()
                    with self.assertRaises(asyncio.CancelledError):
                        await task
                    released.set()
            self.assertEqual((await request).value, "'line'")

    async def test_a_timeout_cancels(self):
        async with self.begin() as session:
            with self.assertRaises(TimeoutError) as caught:
                await session.eval("while True: pass", timeout=0.05)
            self.assertEqual(str(caught.exception), "there is no reply yet")
            self.assertEqual((await session.eval("'goes on'", timeout=PATIENCE)).value, "'goes on'")

    async def test_an_exception_that_leaves_the_block_cancels_what_is_open(self):
        with self.assertRaises(LookupError):
            async with self.begin() as session:
                request = session.submit("while True: pass")
                raise LookupError
        with self.assertRaises(krutil.Cancelled):
            await request

    async def test_the_event_loop_goes_on_while_an_engine_reads_nothing(self):
        go = asyncio.Event()
        loop = asyncio.get_running_loop()

        def script(engine):
            engine.send(GREETING)
            engine.read_greeting()
            asyncio.run_coroutine_threadsafe(go.wait(), loop).result(PATIENCE)
            for _ in range(16):
                engine.send(message(engine.read_message().stream, *DONE))
            engine.read_goodbye()
            engine.send(SHUTDOWN)

        engine = ScriptedEngine(script)
        async with krutil.aio.Session(await asyncio.to_thread(krutil.Session, engine.connection)) as session:
            requests = [session.submit_call("f", numpy.zeros(1 << 20), outputs=0) for _ in range(16)]
            go.set()
            self.assertEqual(await asyncio.gather(*requests), [None] * 16)
        await asyncio.to_thread(engine.join)


if __name__ == "__main__":
    unittest.main()
