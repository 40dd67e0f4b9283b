#!/usr/bin/env python3
"""Runs every bench_* program and prints one table of figures against their targets.

Usage: table.py --bin DIR --out FILE --store DIR --objects N --locations L [-- ARGS...]

Each program runs once, with --benchmark_out=<results>/<program>.json; its printed output is
passed through and kept in <results>/<program>.txt. bench/targets.txt says which entry of which
program is which figure and what it should reach. ARGS go to every program (for example
--benchmark_filter=...). The table goes to standard output and to FILE (Markdown). The exit
status is non-zero when a program failed to run; a missed target is a figure, not a failure.
"""
import argparse
import datetime
import fnmatch
import json
import os
import re
import shlex
import subprocess
import sys
import time

TIME_UNITS = {"ns": 1e-9, "us": 1e-6, "ms": 1e-3, "s": 1.0}
# Units a figure may be given in, as a factor to the base unit (seconds, per second, or none).
UNITS = dict(TIME_UNITS, **{"/s": 1.0, "1": 1.0, "%": 1.0, "GB": 1.0})


class Target:
    def __init__(self, program, entry, value, target, figure):
        self.program, self.entry, self.figure = program, entry, figure
        words = value.split()
        if entry.startswith("output:"):
            self.kind, self.unit = "output", words[-1]
        elif words[0] == "counter":
            self.kind, self.counter, self.unit = "counter", words[1], words[2]
        elif words[0] in ("real_time", "cpu_time"):
            self.kind, self.unit = words[0], None
        else:
            raise ValueError("unknown value %r" % value)
        if target.strip() == "-":
            self.op = None
            self.target_unit = self.unit if self.unit and self.unit in UNITS and self.kind != "counter" else None
        else:
            op, number, unit = target.split()
            if op not in ("<=", ">=") or unit not in UNITS:
                raise ValueError("bad target %r" % target)
            self.op, self.target, self.target_unit = op, float(number), unit


def read_targets(path, substitutions):
    runs, targets = {}, []
    with open(path, encoding="utf-8") as f:
        for number, line in enumerate(f, 1):
            line = line.strip()
            if not line or line.startswith("#"):
                continue
            columns = [c.strip() for c in line.split(" | ")]
            try:
                if columns[0] == "run" and len(columns) == 3:
                    words = shlex.split(columns[2].format(**substitutions))
                    env = {}
                    while words and not words[0].startswith("-") and "=" in words[0]:
                        name, value = words.pop(0).split("=", 1)
                        env[name] = value
                    runs[columns[1]] = (env, words)
                elif columns[0] == "target" and len(columns) == 6:
                    targets.append(Target(*columns[1:]))
                else:
                    raise ValueError("expected a run or target line")
            except (ValueError, IndexError, KeyError) as error:
                sys.exit("%s:%d: %s" % (path, number, error))
    return runs, targets


def run_program(path, env_extra, args, results):
    name = os.path.basename(path)
    json_path = os.path.join(results, name + ".json")
    text_path = os.path.join(results, name + ".txt")
    if os.path.exists(json_path):
        os.remove(json_path)
    command = [path] + args + ["--benchmark_out=" + json_path, "--benchmark_out_format=json"]
    print("==== %s %s" % (name, " ".join(shlex.quote(a) for a in command[1:])), flush=True)
    env = dict(os.environ, **env_extra)
    started = time.monotonic()
    output = []
    with subprocess.Popen(command, env=env, stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                          text=True, errors="replace") as process:
        for line in process.stdout:
            sys.stdout.write(line)
            sys.stdout.flush()
            output.append(line)
    took = time.monotonic() - started
    with open(text_path, "w", encoding="utf-8") as f:
        f.writelines(output)
    entries = []
    if os.path.exists(json_path):
        try:
            with open(json_path, encoding="utf-8") as f:
                entries = json.load(f).get("benchmarks", [])
        except json.JSONDecodeError:
            entries = []
    return {"rc": process.returncode, "seconds": took, "output": "".join(output), "entries": entries}


def stored_result(program, results):
    result = {"rc": 0, "seconds": 0.0, "output": "", "entries": []}
    try:
        with open(os.path.join(results, program + ".txt"), encoding="utf-8") as f:
            result["output"] = f.read()
        with open(os.path.join(results, program + ".json"), encoding="utf-8") as f:
            result["entries"] = json.load(f).get("benchmarks", [])
    except (OSError, json.JSONDecodeError):
        pass
    return result


def find_entry(entries, pattern):
    return next((e for e in entries if fnmatch.fnmatchcase(e.get("name", ""), pattern)), None)


def measure(target, result):
    """Returns (value in the target's unit or None, note)."""
    if result is None:
        return None, "not measured (no such program)"
    unit = target.target_unit or target.unit
    if target.kind == "output":
        matches = re.findall(target.entry[len("output:"):].strip(), result["output"])
        if not matches:
            return None, "not measured (not in the output)"
        last = matches[-1]
        if isinstance(last, tuple):
            last = next((group for group in last if group), "")
        return float(last) * UNITS[target.unit] / UNITS[unit], None
    entry = find_entry(result["entries"], target.entry)
    if entry is None:
        # A benchmark that stopped with an error has only its failed run, no aggregates.
        run = find_entry(result["entries"], re.sub(r"_(median|mean|stddev|cv)$", "", target.entry))
        if run is None or not run.get("error_occurred"):
            return None, "not measured (no entry %s)" % target.entry
        entry = run
    if entry.get("error_occurred"):
        return None, "error: %s" % entry.get("error_message", "")
    if target.kind == "counter":
        if target.counter not in entry:
            return None, "not measured (no counter %s)" % target.counter
        value = float(entry[target.counter]) * UNITS[target.unit]
        return value / UNITS[unit], None
    seconds = float(entry[target.kind]) * TIME_UNITS[entry.get("time_unit", "ns")]
    if unit is None:
        unit = entry.get("time_unit", "ns")
        target.target_unit = unit
    return seconds / UNITS[unit], None


def number(value):
    if value == 0:
        return "0"
    if abs(value) >= 1000:
        return "{:,.0f}".format(value)
    return "{:.3g}".format(value)


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("--bin", required=True)
    parser.add_argument("--out", required=True)
    parser.add_argument("--store", required=True)
    parser.add_argument("--objects", required=True)
    parser.add_argument("--locations", required=True)
    parser.add_argument("--targets", default=os.path.join(os.path.dirname(os.path.abspath(__file__)),
                                                          "targets.txt"))
    parser.add_argument("--only", action="append", default=[],
                        help="run only this program (repeatable); default every bench_* program")
    parser.add_argument("--no-run", action="store_true",
                        help="print the table of the last run again from the results folder")
    parser.add_argument("args", nargs="*")
    options = parser.parse_args()

    runs, targets = read_targets(options.targets, {"store": options.store, "objects": options.objects,
                                                   "locations": options.locations})
    results_dir = os.path.splitext(options.out)[0]
    os.makedirs(results_dir, exist_ok=True)
    programs = sorted(p for p in os.listdir(options.bin)
                      if p.startswith("bench_") and os.access(os.path.join(options.bin, p), os.X_OK)
                      and (not options.only or p in options.only))
    started = datetime.datetime.now(datetime.timezone.utc)
    results = {}
    for program in programs:
        if options.no_run:
            results[program] = stored_result(program, results_dir)
            continue
        env, args = runs.get(program, ({}, []))
        results[program] = run_program(os.path.join(options.bin, program), env, args + options.args, results_dir)

    root = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
    try:
        commit = subprocess.run(["git", "-C", root, "describe", "--always", "--dirty"], capture_output=True,
                                text=True).stdout.strip()
    except OSError:
        commit = "unknown"
    lines = [
        "# Benchmarks",
        "",
        "%s, commit %s, %d cores, load average %s before the run." % (
            started.strftime("%Y-%m-%d %H:%M UTC"), commit or "unknown", os.cpu_count() or 0,
            " ".join("%.1f" % v for v in os.getloadavg())),
        "Seeded stores: %s objects over %s locations (the store targets are for the size their figure "
        "names, so store figures at another size are not the targets' figures)." % (
            "{:,}".format(int(options.objects)), options.locations),
        "Ratio is measured / target: at most 1 is met for a \"<=\" target, at least 1 for \">=\".",
        "",
        "| figure | target | measured | ratio | |",
        "|---|---|---|---|---|",
    ]
    for target in targets:
        value, note = measure(target, results.get(target.program))
        unit = target.target_unit or target.unit or ""
        unit = "" if unit == "1" else unit
        target_text = "-" if target.op is None else "%s %s %s" % (target.op, number(target.target), unit)
        if value is None:
            lines.append("| %s | %s | %s | | |" % (target.figure, target_text, note))
            continue
        measured = ("%s %s" % (number(value), unit)).strip()
        if target.op is None:
            lines.append("| %s | - | %s | | |" % (target.figure, measured))
            continue
        ratio = value / target.target if target.target else float("inf")
        met = ratio <= 1 if target.op == "<=" else ratio >= 1
        lines.append("| %s | %s | %s | %.2f | %s |" % (target.figure, target_text, measured, ratio,
                                                         "met" if met else "MISSED"))
    lines.append("")
    if options.no_run:
        lines.append("Printed again from the stored results of the last run (its date is in the JSON files).")
    for program in programs if not options.no_run else []:
        result = results[program]
        lines.append("- %s: %.0f s%s" % (program, result["seconds"],
                                          "" if result["rc"] == 0 else ", FAILED (exit status %d)" % result["rc"]))
    lines.append("")
    shown = os.path.relpath(results_dir)
    lines.append("Each program's output and JSON are in %s/." % (shown if not shown.startswith("..") else results_dir))
    table = "\n".join(lines) + "\n"
    print()
    sys.stdout.write(table)
    with open(options.out, "w", encoding="utf-8") as f:
        f.write(table)
    print("\nwritten to %s" % options.out)
    return 1 if any(r["rc"] != 0 for r in results.values()) else 0


if __name__ == "__main__":
    sys.exit(main())
