"""Kills a client or an engine at a random moment of its work, thousands of times, and looks at what the other end makes
of it: each request ends once, engines and clients end as they promise, listeners go on serving, and nothing is left.

    kills.py [COUNT] [SEED]

krutil and krutil-qvm are found in the PATH. The seed and the number of a kill decide what is killed, how both ends are
joined, what they do and when it happens; only how far they have come by then is up to the machine. Ends with status 1
when anything is wrong; what is wrong is told.
"""

import collections
import gc
import itertools
import mmap
import multiprocessing
import os
import random
import re
import select
import signal
import subprocess
import sys
import tempfile
import threading
import time
import traceback

# Threads that a library starts would be counted, and would be in the way of forks.
os.environ["OPENBLAS_NUM_THREADS"] = "1"

import krutil
import numpy
from eventually import PATIENCE, eventually
from processes import Listener, adopt_orphans, children, growth, usage

# Of large arrays: 2 MiB, which is shared where both ends can.
ELEMENTS = 1 << 18
ENDLESS = "import time\nwhile True: time.sleep(0.001)"
# When no event has come for so many seconds, the moment has come all the same: code waits for an answer.
LONGEST_WAIT = 0.3

KILLED = r"killed by signal 9"
GONE = r"(Broken pipe|Connection reset by peer)"
WRITING = rf"(; writing to it had failed: {GONE})?"
CLIENT_LOST = (rf"krutil-qvm: (cannot (read from|write to) the stream( during the handshake)?: {GONE}|"
               r"the peer closed the stream during the handshake: .* had arrived|"
               r"the client has gone before the engine's shutdown event|"
               r"the stream ended (between two messages, without the client's goodbye|in the middle of a message: .* "
               rf"had arrived){WRITING})")
SILENT = r"krutil-qvm: a client connected and left without a word, as health checks do(; \d+ did so before)?"
SESSION_KILLED = r"krutil-qvm: the session of process \d+ was ended by signal 9 \(Killed\)"
ENGINE_KILLED = r"krutil: the engine was killed by signal 9 \(Killed\) "
ENGINE_LOST = r"krutil: the engine was lost "
ANSWERED = r"after it answered(: .*)?"
NOT_ANSWERED = r"(before the session began|before it answered|while it was idle)(: .*)?"


class Wrong(Exception):
    """Something that must not be."""


def expect(what, expected, got):
    if got != expected:
        raise Wrong(f"{what}: expected {str(expected)[:500]}, got {str(got)[:500]}")


def expect_one_of(what, allowed, got):
    if got not in allowed:
        raise Wrong(f"{what}: expected one of {allowed}, got {str(got)[:500]}")


def expect_like(what, pattern, got):
    if not re.fullmatch(pattern, got):
        raise Wrong(f"{what}: expected what matches {pattern}, got {got[:500]!r}")


class Moment:
    """When it happens: after so many events, or so many seconds after the beginning."""

    def __init__(self, chance):
        self.events = chance.choice([0, chance.randrange(1, 40)])
        # From 0.1 to 300 ms, as many below 5 ms as above.
        self.seconds = 10 ** chance.uniform(-4, -0.5)

    def pass_bytes(self, descriptor):
        """Waits for it, where each byte is an event."""
        if not self.events:
            time.sleep(self.seconds)
            return
        for _ in range(self.events):
            if not select.select([descriptor], [], [], LONGEST_WAIT)[0] or not os.read(descriptor, 1):
                return

    def pass_events(self, events):
        try:
            for _ in itertools.islice(events, self.events):
                pass
        except TimeoutError:
            pass


class Work:
    """Requests of a session, several at once, and how often each of them has ended."""

    def __init__(self, chance):
        self.chance = random.Random(chance.random())
        self.endless = chance.random() < 0.7
        self.arrays = chance.random() < 0.5
        self.answers = chance.random() < 0.5
        self.requests = []  # with what is right about the result
        self.cancels = []
        self.cancelled = set()
        self.ends = collections.Counter()
        self.kept_asking = False

    def answer(self, question):
        if self.answers:
            return "7"
        if not question.withdrawn(PATIENCE):
            self.kept_asking = True
        return None

    def submit(self, session):
        """Raises Lost or Aborted when the session ends meanwhile."""
        kinds = [self.output, self.value, self.prompt] + self.arrays * [self.small, self.shared, self.sent]
        for number in range(self.chance.randrange(3, 9)):
            request, right = self.chance.choice(kinds)(session, number)
            self.add(request, right)
        # Not where a library may be loading: what it makes of an interruption is its own affair.
        if not self.arrays and self.chance.random() < 0.3:
            number = self.chance.randrange(len(self.requests))
            self.cancelled.add(number)
            answer = self.requests[number][0].submit_cancel()
            self.cancels.append(answer)
            answer.add_done_callback(lambda _: self.count("cancel"))
        if self.endless:
            self.add(session.submit(ENDLESS), lambda result: False)

    def add(self, request, right):
        number = len(self.requests)
        self.requests.append((request, right))
        request.add_done_callback(lambda _: self.count(number))

    def count(self, what):
        self.ends[what] += 1

    def output(self, session, number):
        count = self.chance.choice([1, 10, 1000])
        return (session.submit(f"for n in range({count}): print(n)"),
                lambda result: result.output == "".join(f"{n}\n" for n in range(count)))

    def value(self, session, number):
        return session.submit(f"{number}"), lambda result: result.value == str(number)

    def prompt(self, session, number):
        return session.submit("input('? ')"), lambda result: result.value == "'7'"

    def small(self, session, number):
        array = numpy.full(3, float(number))
        return session.submit_call("numpy.negative", array), lambda result: numpy.array_equal(result, -array)

    def shared(self, session, number):
        array = krutil.empty(ELEMENTS)
        array[:] = number
        return session.submit_call("numpy.negative", array), lambda result: numpy.array_equal(result, -array)

    def sent(self, session, number):
        array = numpy.full(ELEMENTS, float(number))
        return session.submit_call("numpy.negative", array), lambda result: numpy.array_equal(result, -array)

    def events(self):
        """Of all requests, in the order in which they run. Raises TimeoutError when none comes."""
        for request, _ in self.requests:
            yield from request.events(LONGEST_WAIT)

    def await_ends(self):
        for request, _ in self.requests:
            try:
                request.result(PATIENCE)
            except krutil.Error:
                pass

    def judge(self, lost):
        """The session is over; `lost` is what a request says that was lost with it. Returns whether one was."""
        any_lost = False
        for number, (request, right) in enumerate(self.requests):
            what = f"request {number} of {len(self.requests)}"
            expect(f"{what} is done", True, request.done())
            try:
                result = request.result()
            except (krutil.Lost, krutil.Aborted) as error:
                expect_like(what, lost, str(error))
                any_lost = any_lost or number not in self.cancelled
            except krutil.Cancelled:
                expect_one_of(f"the only request that may be cancelled, where {what} was", self.cancelled, number)
            else:
                expect(f"whether a request before {what}, which has an answer, was lost", False, any_lost)
                expect(f"the result of {what} is right", True, right(result))
        for answer in self.cancels:
            expect("the cancel is done", True, answer.done())
            error = answer.exception()
            if error is not None:
                expect_like("the answer to a cancel", lost, str(error))
        ends = {number: 1 for number in range(len(self.requests))} | {"cancel": 1 for _ in self.cancels}
        expect("how often each request has ended", ends, dict(self.ends))
        expect("a question is withdrawn when its session ends", False, self.kept_asking)
        return any_lost


class Worker:
    """A client that survives all kills of engines, with a listener that survives all kills; each is one process."""

    def __init__(self, seed, directory):
        self.seed = seed
        self.directory = directory
        self.faults = []
        self.outcomes = collections.Counter()
        self.samples = {"client": [], "listener": []}
        for name in "HOME", "TMPDIR", "XDG_STATE_HOME", "XDG_CONFIG_HOME":
            os.environ[name] = directory
        tempfile.tempdir = directory
        # What this process says, and engines and clients that it starts.
        self.said = tempfile.TemporaryFile()
        os.dup2(self.said.fileno(), 2)
        threading.excepthook = lambda args: self.faults.append(f"{args.thread}: {args.exc_value!r}")
        sys.excepthook = lambda kind, error, trace: self.faults.append(repr(error))
        sys.unraisablehook = lambda args: self.faults.append(f"{args.object}: {args.exc_value!r}")
        numpy.save(os.path.join(directory, "array.npy"), numpy.zeros(ELEMENTS))
        self.listener = Listener(directory, "listener")
        # Modules that are loaded when they are needed, and memory that stays.
        for begin in self.start, self.connect:
            with begin() as session:
                session.call("numpy.negative", krutil.empty(ELEMENTS))
        gc.collect()
        gc.freeze()
        self.lines = self.heard = 0
        self.listener_lines()
        self.before = self.left()

    # What there is of it all.

    def own_children(self):
        return [pid for pid in children(os.getpid()) if pid != self.listener.process.pid]

    def own_lines(self):
        text = os.pread(2, os.fstat(2).st_size - self.heard, self.heard)
        self.heard += len(text)
        return text.decode(errors="backslashreplace").splitlines()

    def listener_lines(self):
        """What it has said since the last call."""
        said = self.listener.said()
        new = said[self.lines:]
        self.lines = len(said)
        return new

    def left(self):
        """What must be the same after each kill."""
        found = {"files": sorted(os.path.join(place, name) for place, names, files in os.walk(self.directory)
                                 for name in names + files),
                 "shared memory files": [name for name in os.listdir("/dev/shm") if "krutil" in name.lower()],
                 "threads of the client": len(os.listdir("/proc/self/task"))}
        for what, pid in ("client", os.getpid()), ("listener", self.listener.process.pid):
            # Looking needs one, too: the directory.
            entries = (target(f"/proc/{pid}/fd/{entry}") for entry in os.listdir(f"/proc/{pid}/fd"))
            names = [name for name in entries if name is not None and not name.endswith("/fd")]
            found[f"descriptors of the {what}"] = len(names)
            found[f"shared memory of the {what}"] = sum(name.startswith("/memfd:") for name in names)
            with open(f"/proc/{pid}/maps", encoding="utf-8") as maps:
                found[f"mapped shared memory of the {what}"] = sum("/memfd:" in line for line in maps)
        return found

    def expect_nothing_left(self):
        eventually(lambda: not children(self.listener.process.pid), "the end of each session of the listener")
        expect("processes that are left", [], self.own_children())
        # Threads that serve a prompt are told of its end, and nobody waits for them. What they held may be in circles.
        end = time.monotonic() + 10
        gc.collect()
        while (left := self.left()) != self.before and time.monotonic() < end:
            time.sleep(0.005)
            gc.collect()
        expect("what is left", {}, {what: (self.before[what], found) for what, found in left.items()
                                    if found != self.before[what]})
        expect("faults of threads", [], self.faults)

    def expect_service(self):
        with self.connect() as session:
            expect("the value in the next session of the listener", "42", session.eval("6 * 7").value)

    def reap(self):
        """The exit codes of processes that the dead have left."""
        return [os.waitstatus_to_exitcode(self.wait(pid)) for pid in self.own_children()]

    def wait(self, pid):
        """The status of a child that ends."""
        found = []

        def look():
            ended, status = os.waitpid(pid, os.WNOHANG)
            if ended:
                found.append(status)
            return ended
        eventually(look, f"the end of process {pid}")
        return found[0]

    # Both ends.

    def start(self, **options):
        return krutil.start("krutil-qvm --stdio", **options)

    def connect(self, **options):
        return krutil.connect(self.listener.path, **options)

    def find(self, parent, is_over):
        """A descriptor of the only process that the parent starts for a session; None when there is none any more."""
        while not is_over():
            for pid in children(parent):
                if pid != self.listener.process.pid:
                    try:
                        return os.pidfd_open(pid)
                    except ProcessLookupError:
                        return None
        return None

    def kill_found(self, parent, is_over):
        descriptor = self.find(parent, is_over)
        if descriptor is not None:
            try:
                signal.pidfd_send_signal(descriptor, signal.SIGKILL)
            except ProcessLookupError:
                pass
            finally:
                os.close(descriptor)

    def krutil(self, chance, *options):
        """Starts the C++ client. Returns its process and whether only a kill ends what it does."""
        endless = chance.random() < 0.7
        kind = chance.choice(["eval", "call", "repl"])
        typed = ""
        if kind == "call":
            endless = False
            arguments = ["call", *options, "numpy.negative", os.path.join(self.directory, "array.npy")]
        elif kind == "eval":
            end = chance.choice(["import time; time.sleep(1000)", ENDLESS]) if endless else "6 * 7"
            arguments = ["eval", *options, "for n in range(300): print(n)\n" + end]
        else:
            lines = ["for n in range(300): print(n)\n", "1 + 1", "print('on')", "import numpy; numpy.zeros(3)"]
            typed = "".join(chance.choice(lines) + "\n" for _ in range(chance.randrange(3, 9)))
            # Its input stays open, so it would be idle then.
            typed += chance.choice([ENDLESS + "\n\n", ""]) if endless else ""
            arguments = ["repl", "--no-history", *options]
        client = subprocess.Popen(["krutil", *arguments], bufsize=0, stdin=subprocess.PIPE, stdout=subprocess.PIPE)
        client.stdin.write(typed.encode())
        if not endless:
            client.stdin.close()
        return client, endless

    # The kills. Each returns what has become of it.

    def session_is_killed(self, chance, begin, parent, lost):
        """The Python client, here, and an engine that is killed."""
        moment, work = Moment(chance), Work(chance)
        over = threading.Event()

        def kill_in_time():
            time.sleep(moment.seconds)
            self.kill_found(parent, over.is_set)
        killer = None if moment.events else threading.Thread(target=kill_in_time)
        if killer:
            killer.start()
        outcome = "answered before"
        session = None
        try:
            session = begin(on_input=work.answer)
            try:
                work.submit(session)
            except (krutil.Lost, krutil.Aborted):
                outcome = "lost"
            if not killer:
                moment.pass_events(work.events())
                self.kill_found(parent, lambda: session.ended)
            elif work.endless or not work.answers:
                # Something keeps it alive until it is killed.
                killer.join()
            else:
                # Code that asks after the goodbye gets no answer.
                work.await_ends()
            session.close(PATIENCE)
        except (krutil.Lost, krutil.Aborted) as error:
            if session is None:
                expect_like("there is no session",
                            r"the engine has gone( \(killed by signal 9\))? (during the handshake: .*|before it said anything)",
                            str(error))
                outcome = "before it began"
            else:
                expect_like("the end of the session", lost, str(error))
                outcome = "lost"
        finally:
            over.set()
            if killer:
                killer.join()
            if session:
                session.kill()
        if session:
            expect("the session has ended", True, session.ended)
            try:
                session.submit("1")
            except krutil.Lost:
                pass
            else:
                raise Wrong("a session that has ended takes another request")
            if work.judge(lost):
                outcome = "lost"
            if work.endless:
                expect("what becomes of a request without an end", "lost", outcome)
        return outcome

    def engine_of_python(self, chance):
        outcome = self.session_is_killed(chance, self.start, os.getpid(), rf"the engine has gone \({KILLED}\): .+")
        expect("words", [], self.own_lines())
        expect("exit codes of processes that nobody has waited for", [], self.reap())
        return outcome

    def session_of_python(self, chance):
        outcome = self.session_is_killed(chance, self.connect, self.listener.process.pid, r"the engine has gone: .+")
        expect("words", [], self.own_lines())
        self.expect_service()
        self.expect_words_of_killed_session(outcome)
        return outcome

    def expect_words_of_killed_session(self, outcome):
        eventually(lambda: not children(self.listener.process.pid), "the end of each session of the listener")
        if outcome != "answered before":
            eventually(lambda: len(self.listener.said()) > self.lines, "the listener's words about a killed session")
        said = self.listener_lines()
        expect("lines of the listener about a killed session but one", [], said[1:])
        for line in said:
            expect_like("words of the listener", SESSION_KILLED, line)

    def killed_engine_of_krutil(self, chance, parent, how, *options):
        moment = Moment(chance)
        client, endless = self.krutil(chance, *options)
        with client:
            moment.pass_bytes(client.stdout.fileno())
            self.kill_found(parent or client.pid, lambda: client.poll() is not None)
            while os.read(client.stdout.fileno(), 1 << 16):
                pass
            code = client.wait(PATIENCE)
        said = "\n".join(self.own_lines())
        if code == 0 and not endless:
            expect_like("words of krutil", rf"({how}{ANSWERED})?", said)
            return "lost after it answered" if said else "answered before"
        expect("exit code of krutil, whose words were " + repr(said), 3, code)
        expect_like("words of krutil", how + NOT_ANSWERED, said)
        return "before it began" if "began" in said else "lost"

    def engine_of_krutil(self, chance):
        outcome = self.killed_engine_of_krutil(chance, None, ENGINE_KILLED)
        expect("exit codes of processes that krutil has left", [], self.reap())
        return outcome

    def session_of_krutil(self, chance):
        outcome = self.killed_engine_of_krutil(chance, self.listener.process.pid, ENGINE_LOST, "--connect",
                                               self.listener.path)
        self.expect_service()
        self.expect_words_of_killed_session(outcome)
        return outcome

    def python_is_killed(self, chance, begin):
        """The Python client as a process of its own. Returns whether its request has no end."""
        moment, work = Moment(chance), Work(chance)
        mine, its = os.pipe()
        pid = os.fork()
        if pid == 0:
            try:
                session = begin(on_input=work.answer)
                work.submit(session)
                while True:
                    try:
                        for _ in work.events():
                            os.write(its, b".")
                        break
                    except TimeoutError:
                        pass
                session.close(PATIENCE)
                while True:
                    signal.pause()
            except BaseException:
                os.write(2, traceback.format_exc().encode())
            finally:
                os._exit(1)
        os.close(its)
        with os.fdopen(mine, "rb", buffering=0):
            moment.pass_bytes(mine)
        os.kill(pid, signal.SIGKILL)
        expect("exit code of the client", -signal.SIGKILL, os.waitstatus_to_exitcode(self.wait(pid)))
        return work.endless

    def krutil_is_killed(self, chance, *options):
        """The same of the C++ client."""
        moment = Moment(chance)
        client, endless = self.krutil(chance, *options)
        with client:
            moment.pass_bytes(client.stdout.fileno())
            client.kill()
            code = client.wait(PATIENCE)
        expect_one_of("exit code of krutil", [-signal.SIGKILL] if endless else [-signal.SIGKILL, 0], code)
        return endless

    def expect_end_of_engine(self, endless):
        codes = self.reap()
        said = self.own_lines()
        if not codes:
            expect("words without an engine", [], said)
            return "without an engine"
        expect_one_of("exit codes of engines", [[3]] if endless else [[3], [0]], codes)
        expect("number of lines of an engine that ended with " + str(codes[0]), 1 if codes == [3] else 0, len(said))
        for line in said:
            expect_like("words of the engine", CLIENT_LOST, line)
        return "before it began" if codes == [3] and "handshake" in said[0] else "lost" if said else "answered before"

    def expect_end_of_session(self):
        expect("words", [], self.own_lines())
        self.expect_service()
        eventually(lambda: not children(self.listener.process.pid), "the end of each session of the listener")
        said = self.listener_lines()
        expect("lines of the listener about a killed client but one", [], said[1:])
        for line in said:
            expect_like("words of the listener", f"{CLIENT_LOST}|{SILENT}", line)
        return "answered before, or silent" if not said else "lost" if "handshake" not in said[0] else "before it began"

    def python_with_engine(self, chance):
        return self.expect_end_of_engine(self.python_is_killed(chance, self.start))

    def python_with_session(self, chance):
        self.python_is_killed(chance, self.connect)
        return self.expect_end_of_session()

    def krutil_with_engine(self, chance):
        return self.expect_end_of_engine(self.krutil_is_killed(chance))

    def krutil_with_session(self, chance):
        self.krutil_is_killed(chance, "--connect", self.listener.path)
        return self.expect_end_of_session()

    KINDS = {"engine of the Python client": engine_of_python, "engine of krutil": engine_of_krutil,
             "session of the Python client at a listener": session_of_python,
             "session of krutil at a listener": session_of_krutil,
             "Python client with an engine": python_with_engine, "krutil with an engine": krutil_with_engine,
             "Python client at a listener": python_with_session, "krutil at a listener": krutil_with_session}

    def kill(self, number):
        chance = random.Random(f"{self.seed} {number}")
        kind = chance.choice(list(self.KINDS))
        try:
            outcome = self.KINDS[kind](self, chance)
            self.expect_nothing_left()
        except Exception as error:
            told = str(error) if isinstance(error, (Wrong, AssertionError)) else traceback.format_exc()
            raise Wrong(f"kill {number} of seed {self.seed}, {kind}: {told}"
                        + "".join(f"\n    said: {line}" for line in self.own_lines() + self.listener_lines())) from None
        self.outcomes[f"{kind}: {outcome}"] += 1
        if number % 10 == 0:
            self.samples["client"].append(usage(os.getpid()))
            self.samples["listener"].append(usage(self.listener.process.pid))

    def stop(self):
        expect("exit code of the listener", 0, self.listener.stop())
        expect("words of the listener", [], self.listener_lines())


def target(link):
    try:
        return os.readlink(link)
    except FileNotFoundError:
        return None


def work(seed, numbers, stopped, report):
    """A worker's process. Reports its outcomes and samples, or what is wrong."""
    adopt_orphans()
    try:
        with tempfile.TemporaryDirectory() as directory:
            worker = Worker(seed, directory)
            try:
                for number in numbers:
                    if stopped[0]:
                        break
                    worker.kill(number)
                worker.stop()
            finally:
                while left := children(os.getpid()):
                    for pid in left:
                        os.kill(pid, signal.SIGKILL)
                        os.waitpid(pid, 0)
        report.send((worker.outcomes, worker.samples, ""))
    except BaseException as error:
        stopped[0] = 1
        report.send((None, None, str(error) if isinstance(error, Wrong) else traceback.format_exc()))


def main():
    count = int(sys.argv[1]) if len(sys.argv) > 1 else 1000
    seed = sys.argv[2] if len(sys.argv) > 2 else str(random.SystemRandom().randrange(10**6))
    print(f"{count} kills, seed {seed}", flush=True)
    begin = time.monotonic()
    # Each waits for others most of the time.
    workers = min(4, 2 * len(os.sched_getaffinity(0)))
    stopped = mmap.mmap(-1, 1)
    context = multiprocessing.get_context("fork")
    reports = []
    for first in range(workers):
        mine, its = context.Pipe(duplex=False)
        process = context.Process(target=work, args=(seed, range(first, count, workers), stopped, its))
        process.start()
        its.close()
        reports.append((process, mine))
    outcomes, wrong = collections.Counter(), []
    for number, (process, report) in enumerate(reports):
        try:
            done, samples, fault = report.recv()
        except EOFError:
            done, samples, fault = None, None, "the worker has ended without a word"
        process.join()
        if fault:
            wrong.append(fault)
            continue
        outcomes += done
        for what, used in samples.items():
            if len(used) < 90:
                continue
            grown = growth(used)
            last = used[-1]
            print(f"worker {number}, {what}: {last.memory} KiB, {last.descriptors} descriptors, {last.threads} "
                  f"threads; more than before: {grown.memory} KiB, {grown.descriptors}, {grown.threads}")
            if grown.memory > 1024 or grown.descriptors or grown.threads:
                wrong.append(f"worker {number}, {what}: what it uses grows: {grown}")
    for what, times in sorted(outcomes.items()):
        print(f"{times:6} {what}")
    seconds = time.monotonic() - begin
    print(f"{sum(outcomes.values())} kills in {seconds:.0f} s")
    for fault in wrong:
        print(f"WRONG: {fault}")
    return 1 if wrong else 0


if __name__ == "__main__":
    sys.exit(main())
