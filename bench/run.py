"""Asks questions about speed, and writes a table, a JSON file and a picture for each. ./scripts/bench calls it.

    run.py --build BUILD --out DIRECTORY [--peers] [--quick] [--large] [--check | --record] [--list] [QUESTION...]
"""

import argparse
import json
import os
import shutil
import sys

import ratios
from questions import ONE_CORE, QUESTIONS, Run

ROOT = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
RECORD = os.path.join(ROOT, "bench", "baseline.json")
FIGURES = os.path.join(ROOT, "docs", "performance")


def placed(placement, measure, run):
    """The rows of a question while this process, and so all that it starts, has one core or those it had before."""
    cores = os.sched_getaffinity(0)
    if placement == ONE_CORE:
        os.sched_setaffinity(0, {min(cores)})
    try:
        rows = measure(run)
    finally:
        os.sched_setaffinity(0, cores)
    return [{**row, "label": ", ".join(part for part in (placement, row["label"]) if part)} for row in rows]


def ask(question, run):
    """All results of a question."""
    results = []
    for placement in question.placements:
        for row in placed(placement, question.measure, run):
            results += ratios.compare(row)
    return results


def description(question):
    """What is written about a question beside its results."""
    return {key: getattr(question, key) for key in ("name", "title", "baseline", "conditions", "unit", "axis")}


def load_record():
    if not os.path.exists(RECORD):
        return {}
    with open(RECORD, encoding="utf-8") as stream:
        return json.load(stream)


def save(path, value):
    with open(path, "w", encoding="utf-8") as stream:
        json.dump(value, stream, indent=1)
        stream.write("\n")


def judged(question, results):
    """The results that are recorded and checked: the library's own. Where the scheduler happens to put two processes
    changes a ratio by more than any tolerance, so what is left to it counts only when a question has nothing else."""
    return [result for result in results if result["contender"] == "krutil"
            and (result["case"].startswith(ONE_CORE) or ONE_CORE not in question.placements)]


def check(question, results, run):
    """What became worse than recorded. A result that looks worse is measured again, and is worse if it is so twice."""
    recorded = load_record().get(question.name, {})
    suspects = [ratios.name_of(result) for result in judged(question, results)
                if ratios.regressions(question.name, [result], recorded, question.tolerance)]
    if not suspects:
        return []
    again = [result for result in judged(question, ask(question, run)) if ratios.name_of(result) in suspects]
    return ratios.regressions(question.name, again, recorded, question.tolerance)


def record(question, results):
    """Replaces what is recorded of a question."""
    medians = {ratios.name_of(result): round(result["ratio"][1], 3) for result in judged(question, results)}
    if medians:
        save(RECORD, dict(sorted({**load_record(), question.name: medians}.items())))


def published():
    """The sections of the document of figures, by the title of their question."""
    try:
        with open(os.path.join(FIGURES, "figures.md"), encoding="utf-8") as stream:
            sections = stream.read().split("\n### ")[1:]
    except FileNotFoundError:
        return {}
    return {section.partition("\n")[0]: "### " + section.rstrip() + "\n" for section in sections}


def publish(out):
    """Writes the tables of all questions that were ever answered there into the document of figures, with the pictures
    of those that go through sizes. What the document says about other questions stays."""
    os.makedirs(FIGURES, exist_ok=True)
    before = published()
    parts = ["# Figures", "What `./scripts/bench --record` has measured last; [performance.md](../performance.md) tells "
             "how, and what the figures mean.\n"]
    for question in QUESTIONS:
        answer = os.path.join(out, question.name + ".json")
        if os.path.exists(answer):
            with open(answer, encoding="utf-8") as stream:
                content = json.load(stream)
            parts.append(ratios.table(content, content["results"]))
            if question.axis:
                shutil.copy(os.path.join(out, question.name + ".svg"), FIGURES)
                parts.append(f"![{question.name}]({question.name}.svg)\n")
        elif question.title in before:
            parts.append(before[question.title])
    with open(os.path.join(FIGURES, "figures.md"), "w", encoding="utf-8") as stream:
        stream.write("\n".join(parts))


def main():
    parser = argparse.ArgumentParser(prog="./scripts/bench", description="Measures how long things take, each beside a "
                                     "baseline in the same run, and shows the ratios.")
    parser.add_argument("questions", nargs="*", metavar="QUESTION", help="what to ask (default: all)")
    parser.add_argument("--build", required=True, help=argparse.SUPPRESS)
    parser.add_argument("--out", required=True, help=argparse.SUPPRESS)
    parser.add_argument("--list", action="store_true", help="list the questions and leave")
    parser.add_argument("--quick", action="store_true", help="fewer and shorter repetitions: less than three minutes")
    parser.add_argument("--large", action="store_true", help="arrays of up to 4 GiB")
    parser.add_argument("--peers", action="store_true", help="measure what people use instead, too")
    parser.add_argument("--check", action="store_true", help="compare with bench/baseline.json; exit code 1 when a "
                        "ratio is worse than recorded, beyond the tolerance of its question, and 3 when the machine is too "
                        "busy to tell")
    parser.add_argument("--record", action="store_true", help="write the ratios to bench/baseline.json, and the "
                        "tables to docs/performance")
    options = parser.parse_args()
    if options.list:
        for question in QUESTIONS:
            print(f"{question.name:16} {question.title}, beside {question.baseline}")
        return 0
    unknown = set(options.questions) - {question.name for question in QUESTIONS}
    if unknown:
        parser.error(f"no such question: {', '.join(sorted(unknown))}; --list shows them")
    run = Run.of(options)
    os.makedirs(options.out, exist_ok=True)
    sentences = []
    if options.check or options.record:
        unrest = ratios.unrest(ask(QUESTIONS[0], run))
        if unrest:
            print(unrest, file=sys.stderr)
            return 3
    for question in QUESTIONS:
        if question.name not in options.questions if options.questions else question.needs_peers > options.peers:
            continue
        results = ask(question, run)
        print(ratios.table(description(question), results), flush=True)
        save(os.path.join(options.out, question.name + ".json"), {**description(question), "results": results})
        import plot  # Only what draws needs matplotlib.
        plot.draw(os.path.join(options.out, question.name + ".svg"), description(question), results)
        if options.check:
            sentences += check(question, results, run)
        if options.record:
            record(question, results)
    if options.record:
        publish(options.out)
    print(f"JSON and SVG files are in {options.out}.")
    if sentences:
        print("Worse than recorded in bench/baseline.json:\n  " + "\n  ".join(sentences), file=sys.stderr)
        return 1
    if options.check:
        print("No ratio is worse than recorded in bench/baseline.json.")
    return 0


if __name__ == "__main__":
    sys.exit(main())
