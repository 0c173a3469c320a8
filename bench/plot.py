"""One picture of a question: bars, or lines when its cases have sizes. Needs matplotlib."""

import matplotlib

matplotlib.use("svg")
import matplotlib.pyplot as plt  # noqa: E402

import ratios  # noqa: E402

matplotlib.rcParams["svg.fonttype"] = "none"
matplotlib.rcParams["svg.hashsalt"] = "krutil"


def _bars(axes, results):
    names = [ratios.name_of(result) for result in results]
    medians = [result["ratio"][1] for result in results]
    spread = [[result["ratio"][1] - result["ratio"][0] for result in results],
              [result["ratio"][2] - result["ratio"][1] for result in results]]
    axes.barh(names, medians, xerr=spread, color="#4878a8", ecolor="black", capsize=3)
    axes.axvline(1, color="black", linewidth=0.8)
    axes.invert_yaxis()
    axes.set_xlabel("ratio to the baseline")


def _lines(axes, results, axis):
    series = {}
    for result in results:
        series.setdefault(ratios.series_of(result), []).append(result)
    for name, points in series.items():
        sizes = [point["size"] for point in points]
        axes.plot(sizes, [point["ratio"][1] for point in points], marker="o", markersize=3, label=name)
        axes.fill_between(sizes, [point["ratio"][0] for point in points], [point["ratio"][2] for point in points],
                          alpha=0.25)
    axes.axhline(1, color="black", linewidth=0.8)
    if min(result["size"] for result in results) > 0:
        axes.set_xscale("log", base=2 if "bytes" in axis else 10)
    axes.set_yscale("log")
    axes.set_xlabel(axis)
    axes.set_ylabel("ratio to the baseline")
    axes.legend()


def draw(path, question, results):
    """Writes the picture as SVG."""
    with_sizes = bool(question["axis"])
    figure, axes = plt.subplots(figsize=(8, 4.5 if with_sizes else 1.2 + 0.35 * len(results)))
    if with_sizes:
        _lines(axes, results, question["axis"])
    else:
        _bars(axes, results)
    axes.set_title(question["title"].replace("`", "") + "\nbaseline = 1: " + question["baseline"].replace("`", ""),
                   fontsize=9)
    figure.savefig(path, bbox_inches="tight", metadata={"Date": None})
    plt.close(figure)
