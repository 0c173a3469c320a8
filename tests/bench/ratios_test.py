"""Ratios, tables and verdicts of made-up measurements.

    ratios_test.py BENCH
"""

import sys
import unittest

sys.path.insert(0, sys.argv.pop(1))

import processes  # noqa: E402
import ratios  # noqa: E402


def row(ours, baseline, label="one core", size=None):
    return {"label": label, "size": size, "times": [{"name": "raw", "seconds": baseline},
                                                    {"name": "krutil", "seconds": ours}]}


QUESTION = {"title": "Evaluation", "baseline": "a round trip", "conditions": "Warm.", "unit": "seconds"}


class RatiosTest(unittest.TestCase):
    def test_a_ratio_is_taken_repetition_by_repetition(self):
        # The machine was ten times slower in the last repetition, on both sides.
        result, = ratios.compare(row([2.0, 4.0, 30.0], [1.0, 1.0, 10.0]))
        self.assertEqual(result["ratio"], [2.5, 3.0, 3.5])
        self.assertEqual(result["figure"], [3.0, 4.0, 17.0])
        self.assertEqual(result["repetitions"], 3)

    def test_a_single_repetition_has_no_spread(self):
        self.assertEqual(ratios.compare(row([3.0], [2.0]))[0]["ratio"], [1.5, 1.5, 1.5])

    def test_each_contender_is_compared_with_the_first(self):
        measured = row([3.0], [2.0], size=16)
        measured["times"].append({"name": "other", "seconds": [8.0]})
        self.assertEqual([(each["contender"], each["baseline"], each["size"], each["ratio"][1])
                          for each in ratios.compare(measured)],
                         [("krutil", "raw", 16, 1.5), ("other", "raw", 16, 4.0)])

    def test_table(self):
        results = ratios.compare(row([8e-6, 9e-6, 10e-6], [1e-6, 1e-6, 1e-6]))
        self.assertEqual(ratios.table(QUESTION, results),
                         "### Evaluation\n\nBaseline: a round trip. Warm.\n\n"
                         "| case | ratio | quartiles | median | of the baseline |\n|---|---|---|---|---|\n"
                         "| one core, krutil | 9.00 | 8.50 to 9.50 | 9 us | 1 us |\n")

    def test_figures_are_written_with_their_units(self):
        self.assertEqual([ratios.figure_text(value, "seconds") for value in (2.5, 0.0125, 3e-6, 84.4e-9)],
                         ["2.5 s", "12.5 ms", "3 us", "84.4 ns"])
        self.assertEqual(ratios.figure_text(5 * 2**20, "bytes"), "5.0 MiB")

    def test_a_size_is_part_of_a_name_but_not_of_a_series(self):
        for size, text in ((16, "16"), (100_000, "100,000"), (65_536, "64 Ki"), (4 * 2**20, "4 Mi"), (2**32, "4 Gi")):
            result, = ratios.compare(row([3.0], [2.0], size=size))
            self.assertEqual(ratios.name_of(result), f"one core, krutil, {text}")
            self.assertEqual(ratios.series_of(result), "one core, krutil")

    def test_contenders_have_their_turns_one_after_the_other(self):
        turns = []
        measured = processes.in_turn("cold", 2, [("a", lambda: turns.append("a") or 1.0),
                                                 ("b", lambda: turns.append("b") or 3.0)])
        self.assertEqual(turns, ["a", "b"] * 3)
        self.assertEqual(measured, {"label": "cold", "size": None,
                                    "times": [{"name": "a", "seconds": [1.0, 1.0]},
                                              {"name": "b", "seconds": [3.0, 3.0]}]})

    def test_a_process_that_prints_something_else_is_no_measurement(self):
        with self.assertRaisesRegex(RuntimeError, r"^/bin/echo 3: expected b'2\\n', got b'3\\n'$"):
            processes.run_checked(["/bin/echo", "3"], b"2\n")


class VerdictTest(unittest.TestCase):
    def verdict(self, ours, recorded, tolerance=0.25):
        results = ratios.compare(row(ours, [1.0] * len(ours)))
        return ratios.regressions("evaluation", results, recorded, tolerance)

    def test_as_recorded_or_better(self):
        self.assertEqual(self.verdict([8.0, 8.0, 8.0], {"one core, krutil": 8.0}), [])
        self.assertEqual(self.verdict([2.0, 2.0, 2.0], {"one core, krutil": 8.0}), [])

    def test_within_the_tolerance(self):
        self.assertEqual(self.verdict([10.0, 10.0, 10.0], {"one core, krutil": 8.0}), [])

    def test_beyond_the_tolerance(self):
        self.assertEqual(self.verdict([10.5, 11.0, 12.0], {"one core, krutil": 8.0}),
                         ["evaluation, one core, krutil: 11.00 times the baseline (lower quartile 10.75), recorded 8.00; "
                          "more than 25% worse"])

    def test_a_spread_that_reaches_into_the_tolerance_is_no_regression(self):
        self.assertEqual(self.verdict([8.0, 11.0, 30.0], {"one core, krutil": 8.0}), [])

    def test_a_case_that_nobody_recorded(self):
        self.assertEqual(self.verdict([1.0], {"two cores, krutil": 8.0}),
                         ["evaluation, one core, krutil: not recorded; ./scripts/bench --record evaluation does that"])

    def test_a_busy_machine_is_found_by_the_null_case(self):
        self.assertEqual(ratios.unrest(ratios.compare(row([1.1, 1.0, 0.9], [1.0, 1.0, 1.0]))), "")
        for ours, text in (([1.2], "1.20"), ([0.5], "0.50")):
            self.assertEqual(ratios.unrest(ratios.compare(row(ours, [1.0]))),
                             f"null, one core, krutil: {text} times itself; the machine is too busy to compare anything. "
                             "Wait, or measure with real-time priority: chrt -f 10 ./scripts/bench, as root")


if __name__ == "__main__":
    unittest.main()
