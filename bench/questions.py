"""What is measured, in the order of the tables, and beside what."""

import dataclasses
import json
import os
import subprocess
import sys

import processes

ONE_CORE = "one core"
SCHEDULER = "left to the scheduler"
WARM = "Buffers and caches are warm on both sides."


@dataclasses.dataclass(frozen=True)
class Question:
    """A table. `measure` is called with a Run and yields rows, for each of the placements of the processes."""
    name: str
    title: str
    baseline: str
    measure: object
    placements: tuple = (ONE_CORE, SCHEDULER)
    conditions: str = WARM
    tolerance: float = 0.25  # how much worse than recorded a ratio may be, as a share of it
    unit: str = "seconds"
    axis: str = ""  # what the size of a row is; without it the plot has bars
    needs_peers: bool = False  # only of interest beside what people use instead


@dataclasses.dataclass(frozen=True)
class Run:
    """How a question is to be asked."""
    build: str  # the build tree
    repetitions: int
    batch: float  # seconds that a contender has in a repetition
    seconds: float  # after which a contest ends, once it has three repetitions
    largest: int  # bytes of an array, in the questions that go through sizes
    peers: bool  # whether what people use instead is measured as well

    @staticmethod
    def of(options):
        effort = (5, 0.02, 1.0, 1 << 26) if options.quick else (15, 0.05, 20.0, 1 << 28)
        run = Run(options.build, *effort, options.peers)
        return dataclasses.replace(run, largest=1 << 32) if options.large else run

    def program(self, *path):
        return os.path.join(self.build, *path)


def rows_of(command):
    """The rows that a program prints, each a line of JSON."""
    output = subprocess.run(command, stdin=subprocess.DEVNULL, stdout=subprocess.PIPE, check=True).stdout
    return [json.loads(line) for line in output.splitlines()]


def engine(name, *options):
    """Asks the program that measures real engines."""
    return lambda run: rows_of([run.program("bench", "krutil_bench_engine"), name, *options,
                                "--repetitions", str(run.repetitions), "--batch", str(run.batch),
                                "--seconds", str(run.seconds), "--largest", str(run.largest)])


def beside_jupyter(run):
    """Evaluations on the Jupyter kernel have their turns between those on an engine."""
    from peers import jupyter  # Only a run with peers has what it needs.
    times = {}
    with jupyter.evaluations() as evaluate:
        evaluate(10)
        for _ in range(run.repetitions):
            row, = engine("evaluation")(dataclasses.replace(run, repetitions=1))
            row["times"].append({"name": "Jupyter", "seconds": [evaluate(20)]})
            for each in row["times"]:
                times.setdefault(each["name"], []).extend(each["seconds"])
    return [{"label": "", "size": None, "times": [{"name": name, "seconds": all} for name, all in times.items()]}]


def python_client(contests):
    """Asks the client for Python. `contests` are triples: a question to the C++ client, what is put before its labels, and
    what the client for Python does for them. They have their turns one after the other."""
    def measure(run):
        import python_client as client
        sys.path.insert(0, run.program("python"))
        return [row for question, label, make in contests for row in _beside_cpp(run, client, question, label, make)]
    return measure


def _beside_cpp(run, client, question, label, make):
    times = {}
    for _ in range(run.repetitions):
        rows = engine(question)(dataclasses.replace(run, repetitions=1, largest=1 << 26))
        # Both start an engine each time: where the memory of a process happens to lie makes a difference.
        with getattr(client, make)(run) as works:
            for row in rows:
                if row["label"] in works:
                    baseline, ours = times.setdefault(row["label"], ([], []))
                    baseline += [each["seconds"][0] for each in row["times"] if each["name"] == "krutil"]
                    ours.append(client.seconds_of(works[row["label"]], run.batch))
    return [{"label": label + case, "size": None,
             "times": [{"name": "C++", "seconds": baseline}, {"name": "krutil", "seconds": ours}]}
            for case, (baseline, ours) in times.items()]


def codec(prefix):
    """Asks the program that measures what one thread does. The prefix of its comparisons is the question."""
    def measure(run):
        rows = rows_of([run.program("bench", "krutil_bench"), "--rows", f"--benchmark_filter=^{prefix}/",
                        f"--benchmark_repetitions={run.repetitions}", f"--benchmark_min_time={run.batch}"])
        return [{**row, "label": row["label"].removeprefix(prefix + "/")} for row in rows]
    return measure


RAW = "a raw framed round trip of the same bytes, from process to process"
RAW_ARRAY = "the same bytes sent raw, from process to process, each of which uses one buffer all the time"
CPP_CLIENT = "the C++ client, which does the same with another engine"
BARE_CODE = "bare Protocol Buffers code for the same object"
ICU = "one call of ICU, with room for the longest result"
REUSED = "The array is the same each time; what the engine and the client do with memory is up to them."
FILES = "Files are in the page cache; nothing else is kept from one start to the next."

# The null case comes first.
QUESTIONS = [
    Question("null", "The harness itself: a raw round trip of 200 bytes there and 500 back",
             "the same once more, so the ratio must be 1 within its spread", engine("null")),
    Question("evaluation", "Evaluation of `1+1`, request to reply", RAW, engine("evaluation")),
    Question("jupyter", "Evaluation of `1+1` on a warm engine, and on a Jupyter kernel of the same Python", RAW,
             beside_jupyter, needs_peers=True),
    Question("call", "A call with 1 KiB, there and back", "an evaluation of `1+1` on a warm engine", engine("call")),
    Question("arrays", "Calls with arrays, over the socket", RAW_ARRAY, engine("arrays"), conditions=REUSED),
    Question("shared-arrays", "Calls with arrays in shared memory", RAW_ARRAY, engine("shared-arrays"),
             conditions="The array is the same each time, so its memory is warm. Who reads it looks at each cache "
                        "line; what goes there and back is looked at by nobody within the time."),
    Question("burst", "1,000 requests (`pass`) sent at once, each of them", RAW, engine("burst")),
    Question("lines", "10,000 lines printed in one request, each of them", "one write of 16 bytes to a socket",
             engine("lines")),
    Question("python-evaluation", "Evaluation of `1+1` by the client for Python", CPP_CLIENT,
             python_client([("evaluation", "", "evaluations")])),
    Question("python-arrays", "Calls with 64 MiB by the client for Python", CPP_CLIENT,
             python_client([("arrays", "over the socket, ", "arrays"),
                            ("shared-arrays", "in shared memory, ", "shared_arrays")]), conditions=REUSED),
    Question("lines-shown", "200,000 lines printed and shown by `krutil`, the whole process",
             "`python3 -u` that prints them", processes.lines_shown, conditions=FILES),
    Question("start", "`krutil eval 1+1` with an engine of its own, the whole process", "`python3 -c 1+1`",
             processes.evaluation_with_own_engine, conditions=FILES),
    Question("connect", "`krutil eval 1+1 --connect` to an engine that listens, the whole process", "`python3 -c 1+1`",
             processes.evaluation_with_listening_engine,
             conditions="Files are in the page cache, the engine listens already, and each session is new."),
    Question("memory", "Private memory of an idle session of a listening engine, after `print(1+1)`",
             "a `python3` that has printed the same and waits", processes.idle_memory, placements=(SCHEDULER,),
             conditions="All processes are there at the same time.", unit="bytes"),
    Question("serialize", "An object to its frames: look-up by type, casts, conversion, frame, append", BARE_CODE,
             codec("serialize"), placements=(ONE_CORE,)),
    Question("deserialize", "Frames to an object: look-up by tag, parsing, conversion", BARE_CODE, codec("deserialize"),
             placements=(ONE_CORE,)),
    Question("to-utf-8", "Text from UTF-16 to UTF-8", ICU, codec("to UTF-8"), placements=(ONE_CORE,)),
    Question("to-utf-16", "Text from UTF-8 to UTF-16", ICU, codec("to UTF-16"), placements=(ONE_CORE,)),
    Question("small-messages", "Small messages in the formats that people use instead",
             BARE_CODE, codec("small-messages"), placements=(ONE_CORE,), needs_peers=True),
    Question("message-sizes", "A request and its reply between two ends of a session, without an engine", RAW,
             engine("message-sizes"), placements=(ONE_CORE,), axis="characters of the request"),
    Question("array-sizes", "A call with an array, over the socket", RAW_ARRAY, engine("array-sizes"),
             placements=(ONE_CORE,), conditions=REUSED, axis="bytes of the array"),
    Question("sessions", "An evaluation of `1+1` in each session of a listening engine at the same time, each of them",
             "raw framed round trips of the same bytes with as many processes", engine("sessions"),
             placements=(ONE_CORE,), axis="sessions"),
    Question("queue-lengths", "Requests (`pass`) sent at once, each of them", RAW, engine("queue-lengths"),
             placements=(ONE_CORE,), axis="requests sent at once"),
    Question("causes", "An error with causes", "an evaluation of `1+1` on a warm engine", engine("causes"),
             placements=(ONE_CORE,), axis="causes"),
]
