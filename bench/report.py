#!/usr/bin/env python3
"""Prints the tables of a tarn-bench run (Google Benchmark JSON, run with
repetitions) as Markdown, with the ratio against every performance target,
and draws the chart with gnuplot.

    report.py RESULTS.json [--posting MORE.json ...] [--svg CHART.svg|.png]

--posting adds further runs of the posting benchmarks: Asio's posting rate
swings between runs, so the posting ratios are given for every run and as a
range. --svg writes ns per delivery against N for every peer and posts per
second per peer (skipped with a message when gnuplot is missing).

Exit status: 0, or 1 when a benchmark reported an error (a failed
correctness check), or 2 when a file cannot be read. A missed target is
reported, not turned into a failure.
"""
import argparse
import json
import os
import shutil
import subprocess
import sys
import tempfile

DELIVERY = [("Floor", "raw loop of virtual calls (floor)"),
            ("LockedFloor", "the same, one lock hold per step (the floor of Tarn's walk)"), ("Signals2", "boost::signals2"),
            ("Sigc", "libsigc++ 3"), ("QtFunctor", "Qt 5, direct connection to a functor"),
            ("QtSlot", "Qt 5, direct connection to a slot"), ("TarnPlain", "Tarn Broadcaster, Listener*"),
            ("TarnWeak", "Tarn Broadcaster, std::weak_ptr"), ("TarnStation", "Tarn, by station ID")]
ATTACH = [("Signals2", "boost::signals2 connect + disconnect"), ("Sigc", "libsigc++ 3 connect + disconnect"),
          ("QtFunctor", "Qt 5 connect + disconnect, functor"), ("QtSlot", "Qt 5 connect + disconnect, slot"),
          ("TarnPlain", "Tarn AddListener + RemoveListener (Listener*)")]
DETACH = [("Signals2", "boost::signals2 disconnect"), ("Sigc", "libsigc++ 3 disconnect"),
          ("QtFunctor", "Qt 5 disconnect, functor"), ("QtSlot", "Qt 5 disconnect, slot"),
          ("TarnPlain", "Tarn RemoveListener (Listener*)"), ("TarnTyped", "Tarn Registration::Reset (Subscribe)")]
DETACH_SIZES = [1000, 10000, 100000]
POSTING = [("Tarn", "Tarn PostMessageToUIThread + flush"), ("Asio", "boost::asio post + run"),
           ("MutexQueue", "std::mutex + std::deque + std::condition_variable"),
           ("Qt", "Qt 5 invokeMethod, Qt::QueuedConnection")]
ALLOC_POSTS = [("TarnDirect", "Tarn, main thread, inForceAsync false (direct)"),
               ("TarnDeferredMain", "Tarn, main thread, inForceAsync true (deferred)"),
               ("TarnDeferredWorker", "Tarn, worker thread (deferred)"), ("AsioWorker", "boost::asio post, worker thread")]
SIZES = [1, 10, 100, 1000]
SHORT = {"Tarn": "Tarn", "Asio": "boost::asio", "MutexQueue": "mutex queue", "Qt": "Qt 5 queued"}


def base_name(run_name):
    """'Posting/Tarn/1/min_time:0.300/manual_time' -> 'Posting/Tarn/1'."""
    parts = [p for p in run_name.split("/") if ":" not in p and p not in ("manual_time", "real_time")]
    return "/".join(parts)


class Results:
    """The medians (or the single run's values), minima and maxima of one run."""

    def __init__(self, path):
        with open(path) as f:
            data = json.load(f)
        self.context = data.get("context", {})
        self.values = {}  # (name, statistic) -> {field: value}
        self.errors = {}
        for entry in data["benchmarks"]:
            name = base_name(entry.get("run_name", entry["name"]))
            if entry.get("error_occurred"):
                self.errors[name] = entry.get("error_message", "error")
                continue
            statistic = entry.get("aggregate_name", "median") if entry.get("run_type") == "aggregate" else "run"
            fields = {k: v for k, v in entry.items() if isinstance(v, (int, float)) and not isinstance(v, bool)}
            self.values.setdefault((name, statistic), fields)

    def get(self, name, field, statistic="median"):
        for stat in (statistic, "run"):
            value = self.values.get((name, stat), {}).get(field)
            if value is not None:
                return float(value)
        return None

    def ns(self, name, statistic="median"):
        rate = self.get(name, "items_per_second", statistic)
        return 1e9 / rate if rate else None

    def has(self, name):
        return any(key[0] == name for key in self.values) or name in self.errors


def ratio(a, b):
    return a / b if a is not None and b else None


def fmt(value, decimals=2):
    return "n/a" if value is None else f"{value:.{decimals}f}"


def fmt_ns(value):
    return "n/a" if value is None else fmt(value, 2 if value < 10 else 1 if value < 100 else 0)


def table(header, rows):
    lines = ["| " + " | ".join(header) + " |", "|---" + "|---:" * (len(header) - 1) + "|"]
    lines += ["| " + " | ".join(row) + " |" for row in rows]
    return "\n".join(lines) + "\n"


def verdict(value, goal, at_most):
    """'met' or how far the figure is from the goal."""
    if value is None:
        return "n/a"
    if (value <= goal) if at_most else (value >= goal):
        return "met"
    if at_most:
        return "**missed**" if goal == 0 else f"**missed**: {(value / goal - 1) * 100:.0f}% over the limit"
    return f"**missed**: {value / goal * 100:.0f}% of the goal"


def report(res, posting_runs):
    out = []
    ctx = res.context
    load = " ".join(f"{x:.2f}" for x in ctx.get("load_avg", []))
    out.append(f"Run of {ctx.get('date', '?')} on {ctx.get('num_cpus', '?')} CPUs at {ctx.get('mhz_per_cpu', '?')} MHz, "
               f"load average {load} at the start; medians over the repetitions.\n")

    out.append("### Synchronous broadcast to N listeners: ns per delivery\n")
    present = [(k, label) for k, label in DELIVERY if res.has(f"Delivery/{k}/1")]
    out.append(table(["ns per delivery"] + [f"N={n}" for n in SIZES],
                     [[label] + [fmt_ns(res.ns(f"Delivery/{k}/{n}")) for n in SIZES] for k, label in present]))
    if res.has("Delivery/QtFunctor/1"):
        out.append(table(["ratio to Qt 5 functor (lower is faster)"] + [f"N={n}" for n in SIZES],
                         [[label] + [fmt(ratio(res.ns(f"Delivery/{k}/{n}"), res.ns(f"Delivery/QtFunctor/{n}")))
                                     for n in SIZES] for k, label in present if k != "QtFunctor"]))

    out.append("### Attach and detach one listener while N others stay attached: ns per pair\n")
    out.append(table(["ns per attach+detach", "N=10", "N=1000", "N=1000 / N=10"],
                     [[label, fmt_ns(res.ns(f"Attach/{k}/10")), fmt_ns(res.ns(f"Attach/{k}/1000")),
                       fmt(ratio(res.ns(f"Attach/{k}/1000"), res.ns(f"Attach/{k}/10")))]
                      for k, label in ATTACH if res.has(f"Attach/{k}/10")]))

    detaching = [(k, label) for k, label in DETACH if res.has(f"DetachOldest/{k}/1000")]
    if detaching:
        out.append("### N listeners detached oldest first: ns per detach\n")
        out.append(table(["ns per detach"] + [f"N={n:,}" for n in DETACH_SIZES] + ["N=100,000 / N=1,000"],
                         [[label] + [fmt_ns(res.ns(f"DetachOldest/{k}/{n}")) for n in DETACH_SIZES]
                          + [fmt(ratio(res.ns(f"DetachOldest/{k}/100000"), res.ns(f"DetachOldest/{k}/1000")))]
                          for k, label in detaching]))

    out.append("### Posting from worker threads to the main thread\n")
    rate = lambda r, k, p: r.get(f"Posting/{k}/{p}", "items_per_second")
    out.append(table(["posts per second (millions)", "P=1", "P=2", "P=1 / asio", "P=2 / asio"],
                     [[label] + [fmt(rate(res, k, p) and rate(res, k, p) / 1e6) for p in (1, 2)]
                      + [fmt(ratio(rate(res, k, p), rate(res, "Asio", p))) for p in (1, 2)]
                      for k, label in POSTING if res.has(f"Posting/{k}/1")]))
    runs = [res] + posting_runs
    per_run = {p: [ratio(rate(r, "Tarn", p), rate(r, "Asio", p)) for r in runs] for p in (1, 2)}
    out.append(f"Tarn / asio posting rate in each of {len(runs)} runs of the posting benchmarks: " + "; ".join(
        f"P={p}: " + ", ".join(fmt(x) for x in per_run[p]) for p in (1, 2)) + ".\n")
    lat = lambda k, f: res.get(f"Latency/{k}", f)
    out.append(table(["latency at 10,000 posts/s, one producer", "p50 (µs)", "p99 (µs)", "p50 / asio", "p99 / asio"],
                     [[label, fmt(lat(k, "p50_us"), 1), fmt(lat(k, "p99_us"), 1),
                       fmt(ratio(lat(k, "p50_us"), lat("Asio", "p50_us"))),
                       fmt(ratio(lat(k, "p99_us"), lat("Asio", "p99_us")))]
                      for k, label in POSTING if res.has(f"Latency/{k}")]))

    coalescing = [("Plain", "PostMessageToUIThread"), ("Coalesced", "PostCoalescedMessageToUIThread, keyed by worker")]
    if any(res.has(f"Coalescing/{k}") for k, _ in coalescing):
        out.append("### Progress reporting: 1M updates from 2 workers, plain against coalesced posts\n")
        get = lambda k, f: res.get(f"Coalescing/{k}", f)
        out.append(table(["1M progress updates", "posts per second (millions)", "main-thread CPU (ms)", "deliveries"],
                         [[label, fmt(get(k, "posts_per_second") and get(k, "posts_per_second") / 1e6),
                           fmt(get(k, "main_thread_ms"), 1), fmt(get(k, "deliveries"), 0)]
                          for k, label in coalescing if res.has(f"Coalescing/{k}")]))

    if res.has("Burst/Tarn"):
        out.append("### 4,000,000 posts from 2 workers while the main thread runs nothing\n")
        burst = lambda f: res.get("Burst/Tarn", f)
        out.append(table(["resident memory (MiB)", "before", "at the peak", "once run", "high-water reports"],
                         [["Tarn PostMessageToUIThread", fmt(burst("rss_before_mib"), 1), fmt(burst("rss_peak_mib"), 1),
                           fmt(burst("rss_after_mib"), 1), fmt(burst("high_water_reports"), 0)]]))

    out.append("### Allocations\n")
    out.append(table(["per delivery (N=100)", "general-heap allocations", "small blocks"],
                     [[label, fmt(res.get(f"Alloc/Delivery/{k}", "heap_allocs_per_op"), 4),
                       fmt(res.get(f"Alloc/Delivery/{k}", "small_blocks_per_op"), 4)]
                      for k, label in DELIVERY if res.has(f"Alloc/Delivery/{k}")]))
    out.append(table(["per post (10,000 delivered)", "general-heap allocations", "small blocks"],
                     [[label, fmt(res.get(f"Alloc/Post/{k}", "heap_allocs_per_op"), 4),
                       fmt(res.get(f"Alloc/Post/{k}", "small_blocks_per_op"), 4)]
                      for k, label in ALLOC_POSTS if res.has(f"Alloc/Post/{k}")]))
    out.append(table(["per registered listener (1,000 attached)", "small-block bytes", "general-heap bytes",
                      "general-heap allocations"],
                     [[label] + [fmt(res.get(f"Alloc/Listener/{k}", f), d) for f, d in
                                 (("small_block_bytes_per_listener", 1), ("heap_bytes_per_listener", 1),
                                  ("heap_allocs_per_listener", 2))]
                      for k, label in DELIVERY if res.has(f"Alloc/Listener/{k}")]))

    out.append("### Targets\n")
    rows = []

    def target(what, value, goal, at_most, shown=None):
        rows.append([what, shown if shown is not None else fmt(value), ("≤ " if at_most else "≥ ") + fmt(goal, 2),
                     verdict(value, goal, at_most)])

    for p in (1, 2):
        ratios = [x for x in per_run[p] if x is not None]
        spread = f" (range over {len(ratios)} runs {fmt(min(ratios))} to {fmt(max(ratios))})" if len(ratios) > 1 else ""
        target(f"posting rate / asio, P={p}", per_run[p][0], 2.0, False, fmt(per_run[p][0]) + spread)
    for f in ("p50_us", "p99_us"):
        target(f"latency {f[:3]} / asio", ratio(lat("Tarn", f), lat("Asio", f)), 1.0, True)
    target("attach+detach N=1000 / N=10", ratio(res.ns("Attach/TarnPlain/1000"), res.ns("Attach/TarnPlain/10")), 1.5, True)
    target("attach+detach N=1000 / Qt 5", ratio(res.ns("Attach/TarnPlain/1000"), res.ns("Attach/QtFunctor/1000")), 1.0, True)
    for n in (100, 1000):
        target(f"delivery N={n} / Qt 5 functor",
               ratio(res.ns(f"Delivery/TarnPlain/{n}"), res.ns(f"Delivery/QtFunctor/{n}")), 1.0, True)
    target("by station ID / broadcaster, N=1",
           ratio(res.ns("Delivery/TarnStation/1"), res.ns("Delivery/TarnPlain/1")), 1.3, True)
    heaps = [res.get(f"Alloc/Delivery/{k}", "heap_allocs_per_op") for k in ("TarnPlain", "TarnWeak", "TarnStation")]
    most = None if None in heaps else max(heaps)
    target("general-heap allocations per delivery (most of plain, weak, station)", most, 0.0, True, fmt(most, 4))
    for k in ("TarnDeferredMain", "TarnDeferredWorker"):
        blocks = res.get(f"Alloc/Post/{k}", "small_blocks_per_op")
        heap = res.get(f"Alloc/Post/{k}", "heap_allocs_per_op")
        exact = None if blocks is None or heap is None else blocks + heap
        rows.append([f"allocations per deferred post, {k[len('TarnDeferred'):].lower()} thread",
                     f"{fmt(blocks, 4)} small + {fmt(heap, 4)} heap", "= 1 small block",
                     "n/a" if exact is None else "met" if blocks == 1 and heap == 0 else "**missed**"])
    out.append(table(["target", "figure", "goal", "verdict"], rows))
    met = sum(1 for row in rows if row[3] == "met")
    out.append(f"{met} of {len(rows)} targets met.\n")
    for name, message in sorted(res.errors.items()):
        out.append(f"FAILED: {name}: {message}")
    return "\n".join(out)


def chart(res, posting_runs, path):
    gnuplot = shutil.which("gnuplot")
    if gnuplot is None:
        print("report.py: gnuplot not found, no chart (apt-get install gnuplot-nox)", file=sys.stderr)
        return
    peers = [(k, label) for k, label in DELIVERY if res.has(f"Delivery/{k}/1")]
    posts = [(k, label) for k, label in POSTING if res.has(f"Posting/{k}/1")]
    if not peers or not posts:
        print("report.py: no delivery or posting results, no chart", file=sys.stderr)
        return
    with tempfile.TemporaryDirectory() as tmp:
        delivery = os.path.join(tmp, "delivery.dat")
        with open(delivery, "w") as f:
            for k, _ in peers:
                f.writelines(f"{n} {res.ns(f'Delivery/{k}/{n}') or 'NaN'}\n" for n in SIZES)
                f.write("\n\n")
        posting = os.path.join(tmp, "posting.dat")
        with open(posting, "w") as f:
            for k, label in posts:
                values = [res.get(f"Posting/{k}/{p}", "items_per_second") for p in (1, 2)]
                f.write(f'"{SHORT.get(k, k)}" ' + " ".join(
                    str(v / 1e6) if v else "NaN" for v in values) + "\n")
        # A quote inside a single-quoted gnuplot string is written twice.
        lines = ", ".join(f"'{delivery}' index {i} using 1:2 with linespoints lw 2 title '{label.replace(chr(39), chr(39) * 2)}'"
                          for i, (_, label) in enumerate(peers))
        terminal = "pngcairo size 1200,480 font 'sans,10'" if path.endswith(".png") else \
            "svg size 1200,480 dynamic font 'sans,11' background '#ffffff'"
        script = f"""
set terminal {terminal} noenhanced
set output '{path}'
set multiplot layout 1,2
set title 'Synchronous broadcast: ns per delivery'
set logscale xy
set xlabel 'listeners attached (N)'
set ylabel 'ns per delivery (log scale)'
set xtics (1, 10, 100, 1000)
set key top right font ',9'
set grid
plot {lines}
unset logscale xy
set xtics auto
set title 'Posting from workers: millions of posts per second'
set xlabel ''
set ylabel 'million posts per second'
set style data histograms
set style histogram clustered gap 1
set style fill solid 0.8 border -1
set boxwidth 0.9
set xtics rotate by -20 font ',9'
set key top left
set yrange [0:*]
plot '{posting}' using 2:xtic(1) title '1 producer', '' using 3 title '2 producers'
unset multiplot
"""
        subprocess.run([gnuplot], input=script, text=True, check=True)
    print(f"report.py: chart written to {path}", file=sys.stderr)


def main():
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("results")
    parser.add_argument("--posting", nargs="*", default=[], help="further runs of the posting benchmarks")
    parser.add_argument("--svg", help="write the chart here")
    args = parser.parse_args()
    try:
        res = Results(args.results)
        posting_runs = [Results(p) for p in args.posting]
    except (OSError, ValueError, KeyError) as error:
        print(f"report.py: cannot read the results: {error}", file=sys.stderr)
        return 2
    print(report(res, posting_runs))
    if args.svg:
        chart(res, posting_runs, args.svg)
    return 1 if res.errors or any(r.errors for r in posting_runs) else 0


if __name__ == "__main__":
    sys.exit(main())
