"""Ratios of measured times, their tables, and the comparison with recorded ones. Pure functions."""

import statistics


def quartiles(values):
    """The lower quartile, the median and the upper quartile."""
    if len(values) == 1:
        return [values[0]] * 3
    return statistics.quantiles(values, n=4, method="inclusive")


def compare(row):
    """Each contender of a measured row beside the first one, which is the baseline.

    A row has a label, a size or None, and for each contender its figures, one for each repetition. Ratios are taken
    repetition by repetition, so what slows a whole repetition down changes none of them.
    """
    baseline = row["times"][0]
    return [{"case": row["label"], "size": row["size"], "contender": each["name"], "baseline": baseline["name"],
             "ratio": quartiles([ours / theirs for ours, theirs in zip(each["seconds"], baseline["seconds"])]),
             "figure": quartiles(each["seconds"]), "baseline figure": quartiles(baseline["seconds"]),
             "repetitions": len(each["seconds"])}
            for each in row["times"][1:]]


def series_of(result):
    """What a result is called together with those that differ in size only."""
    return ", ".join(part for part in (result["case"], result["contender"]) if part)


def name_of(result):
    """What a result is called in a table and where ratios are recorded."""
    return series_of(result) if result["size"] is None else f"{series_of(result)}, {size_text(result['size'])}"


def size_text(size):
    """A size, with a binary prefix where that is exact."""
    for scale, prefix in ((2**30, " Gi"), (2**20, " Mi"), (2**10, " Ki")):
        if size >= scale and size % scale == 0:
            return f"{size / scale:g}{prefix}"
    return f"{size:,.0f}"


def figure_text(value, unit):
    """A figure with its unit. Seconds get a prefix, bytes become MiB."""
    if unit == "bytes":
        return f"{value / 2**20:.1f} MiB"
    for scale, name in ((1, "s"), (1e-3, "ms"), (1e-6, "us")):
        if value >= scale:
            return f"{value / scale:.3g} {name}"
    return f"{value / 1e-9:.3g} ns"


def table(question, results):
    """The table of a question, in Markdown."""
    lines = [f"### {question['title']}", "",
             f"Baseline: {question['baseline']}. {question['conditions']}", "",
             "| case | ratio | quartiles | median | of the baseline |", "|---|---|---|---|---|"]
    for result in results:
        low, median, high = result["ratio"]
        lines.append(f"| {name_of(result)} | {median:.2f} | {low:.2f} to {high:.2f} "
                     f"| {figure_text(result['figure'][1], question['unit'])} "
                     f"| {figure_text(result['baseline figure'][1], question['unit'])} |")
    return "\n".join(lines) + "\n"


def regressions(name, results, recorded, tolerance):
    """Sentences about the results of a question that are worse than recorded.

    `recorded` holds medians by the name of a result. A ratio is worse when even its lower quartile is above the
    recorded median by more than the tolerance, which is a share of that median.
    """
    sentences = []
    for result in results:
        case = name_of(result)
        low, median, _ = result["ratio"]
        if case not in recorded:
            sentences.append(f"{name}, {case}: not recorded; ./scripts/bench --record {name} does that")
        elif low > recorded[case] * (1 + tolerance):
            sentences.append(f"{name}, {case}: {median:.2f} times the baseline (lower quartile {low:.2f}), recorded "
                             f"{recorded[case]:.2f}; more than {tolerance:.0%} worse")
    return sentences


def unrest(results, tolerance=0.1):
    """A sentence when the null case says that ratios of now mean nothing; empty when they do."""
    for result in results:
        median = result["ratio"][1]
        if abs(median - 1) > tolerance:
            return (f"null, {name_of(result)}: {median:.2f} times itself; the machine is too busy to compare anything. "
                    "Wait, or measure with real-time priority: chrt -f 10 ./scripts/bench, as root")
    return ""
