"""What is measured, in the order of the tables, and beside what."""

import dataclasses
import json
import os
import subprocess

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


@dataclasses.dataclass(frozen=True)
class Run:
    """How a question is to be asked."""
    build: str  # the build tree
    repetitions: int
    batch: float  # seconds that a contender has in a repetition
    largest: int  # bytes of an array, in the questions that go through sizes
    peers: bool  # whether what people use instead is measured as well

    @staticmethod
    def of(options):
        repetitions, batch, largest = (5, 0.02, 1 << 24) if options.quick else (15, 0.05, 1 << 28)
        return Run(options.build, repetitions, batch, 1 << 32 if options.large else largest, options.peers)

    def program(self, *path):
        return os.path.join(self.build, *path)


def rows_of(command):
    """The rows that a program prints, each a line of JSON."""
    output = subprocess.run(command, stdout=subprocess.PIPE, check=True).stdout
    return [json.loads(line) for line in output.splitlines()]


def engine(name, *options):
    """Asks the program that measures real engines."""
    return lambda run: rows_of([run.program("bench", "krutil_bench_engine"), name, *options,
                                "--repetitions", str(run.repetitions), "--batch", str(run.batch)])


def codec(prefix):
    """Asks the program that measures what one thread does. The prefix of its comparisons is the question."""
    def measure(run):
        rows = rows_of([run.program("bench", "krutil_bench"), "--rows", f"--benchmark_filter=^{prefix}/",
                        f"--benchmark_repetitions={run.repetitions}", f"--benchmark_min_time={run.batch}"])
        return [{**row, "label": row["label"].removeprefix(prefix + "/")} for row in rows]
    return measure


QUESTIONS = [
    Question("null", "The harness itself: a raw round trip of 200 bytes there and 500 back",
             "the same once more, so the ratio must be 1 within its spread", engine("null")),
    Question("evaluation", "Evaluation of `1+1`, request to reply",
             "a raw framed round trip of the same bytes, from process to process", engine("evaluation")),
    Question("start", "`krutil eval 1+1` with an engine of its own, the whole process", "`python3 -c 1+1`",
             processes.evaluation_with_own_engine,
             conditions="Files are in the page cache; nothing else is kept from one start to the next."),
    Question("connect", "`krutil eval 1+1 --connect` to an engine that listens, the whole process", "`python3 -c 1+1`",
             processes.evaluation_with_listening_engine,
             conditions="Files are in the page cache; the engine listens already, and the session is new each time."),
]
