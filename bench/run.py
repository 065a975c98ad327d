#!/usr/bin/env python3
"""Times gwarchive against the peer tools on the benchmark corpus and writes
bench/RESULTS.md.

    bench/run.py --build BUILD_DIR [--out bench/RESULTS.md] [--only NAME,...]

NAME is a workload below, "syscalls" (system calls per extracted file) or
"remote" (bench/remote.sh: over HTTP behind 20 ms, as root).

Each workload is one hyperfine call holding every tool that can do it, so all
of them see the same machine load. Every command runs under /usr/bin/time -v,
which records its peak resident memory without an extra run."""

import argparse
import datetime
import json
import os
import platform
import shutil
import subprocess
import sys

HERE = os.path.dirname(os.path.abspath(__file__))
MiB = 1024 * 1024


def log(message):
    print(f"[bench] {message}", flush=True)


class Workload:
    def __init__(self, name, title, archive, runs, commands, goal_peer, goal_ratio, prepare=True,
                 rss_goal_mib=None, settle=False):
        self.name = name
        self.title = title
        self.archive = archive
        self.runs = runs
        self.commands = commands  # tool -> command template
        self.goal_peer = goal_peer
        self.goal_ratio = goal_ratio
        self.prepare = prepare
        self.rss_goal_mib = rss_goal_mib  # gwarchive's peak resident memory, when it has a goal
        # Wait a few seconds after removing the output folder: a file system
        # still freeing 20,000 inodes slows whichever tool comes next.
        self.settle = settle


def workloads():
    extract_zip = {
        "gwarchive": "{gw} extract --no-progress -C {out} {archive}",
        "unzip": "unzip -q -o {archive} -d {out}",
        "bsdtar": "bsdtar -xf {archive} -C {out}",
        "7zz": "7zz x -y -bd -bso0 -o{out} {archive}",
        "unar": "unar -q -f -D -o {out} {archive}",
    }
    extract_xar = {k: v for k, v in extract_zip.items() if k != "unzip"}
    text = "large/text.txt"
    return [
        Workload("small-zip", "Extract 20,000 small text files (ZIP, zip -6)", "small.zip", 3,
                 extract_zip, "unzip", 0.6, settle=True),
        Workload("small-xar", "Extract 20,000 small text files (XAR, bsdtar)", "small.xar", 3,
                 extract_xar, "bsdtar", 0.7),
        Workload("large-zip", "Extract 3 large files, 480 MiB (ZIP, zip -6)", "large.zip", 5,
                 extract_zip, "bsdtar", 0.4),
        Workload("large-xar", "Extract 3 large files, 480 MiB (XAR, bsdtar)", "large.xar", 5,
                 extract_xar, "unar", 0.5),
        Workload("list", "List 200,000 empty entries (stored ZIP)", "list.zip", 10, {
            "gwarchive": "{gw} list {archive}",
            "unzip": "unzip -Z1 {archive}",
            "bsdtar": "bsdtar -tf {archive}",
            "7zz": "7zz l -ba {archive}",
            "unar": "lsar {archive}",
        }, "unzip", 0.8, prepare=False, rss_goal_mib=32),
        Workload("stream", "Stream the 256 MiB text entry to /dev/null (ZIP)", "large.zip", 5, {
            "gwarchive": "{gw} cat {archive} " + text,
            "unzip": "unzip -p {archive} " + text,
            "bsdtar": "bsdtar -xOf {archive} " + text,
            "7zz": "7zz e -so {archive} " + text,
            "unar": "unar -q -o - {archive} " + text,
        }, "bsdtar", 0.5, prepare=False),
        Workload("deflate64", "Stream the 256 MiB text entry to /dev/null (ZIP, 7zz Deflate64)",
                 "deflate64.zip", 5, {
                     "gwarchive": "{gw} cat {archive} " + text,
                     "unzip": "unzip -p {archive} " + text,
                     "7zz": "7zz e -so {archive} " + text,
                 }, "7zz", 2.0, prepare=False),
    ]


def peak_rss_mib(path):
    peak = 0
    if os.path.exists(path):
        for line in open(path):
            if "Maximum resident set size" in line:
                peak = max(peak, int(line.split(":")[1]))
    return peak / 1024


def run_workload(w, gw, corpus, scratch):
    archive = os.path.join(corpus, w.archive)
    out = os.path.join(scratch, "out")
    rss_dir = os.path.join(scratch, "rss")
    os.makedirs(rss_dir, exist_ok=True)
    args = ["hyperfine", "--warmup", "1", "--runs", str(w.runs), "--style", "basic",
            "--export-json", os.path.join(scratch, f"{w.name}.json")]
    if w.prepare:
        settle = " && sync && sleep 5" if w.settle else ""
        args += ["--prepare", f"rm -rf {out} && mkdir -p {out}{settle}"]
    for tool, template in w.commands.items():
        rss = os.path.join(rss_dir, f"{w.name}-{tool}.txt")
        if os.path.exists(rss):
            os.remove(rss)
        command = template.format(gw=gw, archive=archive, out=out)
        # Output goes to /dev/null inside the timed command so that a stream
        # is written, not piped into hyperfine.
        args += ["-n", tool, f"/usr/bin/time -v -a -o {rss} {command} > /dev/null"]
    log(f"{w.title}: {', '.join(w.commands)}")
    subprocess.run(args, check=True)
    shutil.rmtree(out, ignore_errors=True)
    results = json.load(open(os.path.join(scratch, f"{w.name}.json")))["results"]
    rows = []
    for result in results:
        tool = result["command"]
        rows.append({
            "tool": tool,
            "median": result["median"],
            "min": result["min"],
            "max": result["max"],
            "rss": peak_rss_mib(os.path.join(rss_dir, f"{w.name}-{tool}.txt")),
        })
    return rows


def syscalls_per_file(gw, corpus, scratch):
    """System calls per extracted file of the small-file ZIP, counted by strace -f -c."""
    if not shutil.which("strace"):
        return {}
    archive = os.path.join(corpus, "small.zip")
    out = os.path.join(scratch, "out")
    files = int(subprocess.run(["unzip", "-Z1", archive], capture_output=True, text=True,
                               check=True).stdout.count("\n"))
    counts = {}
    for tool, template in {"gwarchive": "{gw} extract --no-progress -C {out} {archive}",
                           "unzip": "unzip -q -o {archive} -d {out}"}.items():
        shutil.rmtree(out, ignore_errors=True)
        os.makedirs(out)
        summary = os.path.join(scratch, f"strace-{tool}.txt")
        command = template.format(gw=gw, archive=archive, out=out)
        subprocess.run(["strace", "-f", "-c", "-o", summary] + command.split(), check=True,
                       stdout=subprocess.DEVNULL)
        total = [line for line in open(summary) if line.rstrip().endswith(" total")][-1]
        counts[tool] = int(total.split()[3]) / max(files, 1)
    shutil.rmtree(out, ignore_errors=True)
    log("system calls per file: " + ", ".join(f"{t} {c:.1f}" for t, c in counts.items()))
    return counts


REMOTE_GOALS = {"extract large.zip": ("ratio", 1.5), "extract small.zip": ("ratio", 2.0),
                "list list.zip": ("requests", 4)}


def remote_rows(build, gw):
    """bench/remote.sh's rows: local time, over HTTP without and with 20 ms, requests."""
    done = subprocess.run(["bash", os.path.join(HERE, "remote.sh"), build], capture_output=True,
                          text=True, env=dict(os.environ, GW=gw))
    rows = []
    for line in done.stdout.splitlines():
        fields = line.split()
        label = " ".join(fields[:-6])
        if label in REMOTE_GOALS:
            local, plain, plain_n, delayed, ratio, delayed_n = fields[-6:]
            rows.append((label, float(local), float(plain), int(plain_n), float(delayed),
                         float(ratio.rstrip("x")), int(delayed_n)))
    if not rows:
        log("remote: " + (done.stdout.strip().splitlines() or [done.stderr.strip()])[-1])
    return rows, done.stdout.splitlines()[:1]


def load_average():
    return " / ".join(f"{x:.2f}" for x in os.getloadavg())


def cpu_model():
    try:
        for line in open("/proc/cpuinfo"):
            if line.startswith("model name"):
                return line.split(":", 1)[1].strip()
    except OSError:
        pass
    return platform.processor() or "unknown"


def write_results(path, measured, load_before, load_after, notes, syscalls=None, remote=None):
    lines = [
        "# Benchmark results",
        "",
        "Produced by `make bench` (bench/run.py); corpus from bench/corpus.py (fixed seed).",
        "Medians of hyperfine runs after one warm-up, output folder removed before",
        "every run; peak resident memory from `/usr/bin/time -v` (largest over the runs).",
        "",
        f"- date: {datetime.datetime.now(datetime.timezone.utc):%Y-%m-%d %H:%M} UTC",
        f"- machine: {os.cpu_count()} cores ({cpu_model()}), "
        f"{os.sysconf('SC_PAGE_SIZE') * os.sysconf('SC_PHYS_PAGES') // (1024 ** 3)} GiB, "
        f"{platform.system()} {platform.release()}",
        f"- load average (1/5/15 min) before: {load_before}; after: {load_after}",
        "",
        "| workload | gwarchive | fastest peer | ratio | goal | gwarchive peak RSS | largest peer RSS |",
        "|---|---|---|---|---|---|---|",
    ]
    for w, rows in measured:
        gw = next(r for r in rows if r["tool"] == "gwarchive")
        peers = [r for r in rows if r["tool"] != "gwarchive"]
        fastest = min(peers, key=lambda r: r["median"])
        ratio = gw["median"] / fastest["median"]
        goal_row = next((r for r in peers if r["tool"] == w.goal_peer), fastest)
        goal_ratio = gw["median"] / goal_row["median"]
        verdict = "met" if goal_ratio <= w.goal_ratio else "not met"
        goal = f"≤ {w.goal_ratio} × {w.goal_peer}: {goal_ratio:.2f}, {verdict}"
        if w.rss_goal_mib:
            met = "met" if gw["rss"] <= w.rss_goal_mib else "not met"
            goal += f"; peak RSS ≤ {w.rss_goal_mib} MiB: {met}"
        lines.append(
            f"| {w.name} | {gw['median']:.3f} s | {fastest['tool']} {fastest['median']:.3f} s "
            f"| {ratio:.2f} | {goal} "
            f"| {gw['rss']:.1f} MiB | {max(r['rss'] for r in peers):.1f} MiB |")
    for w, rows in measured:
        fastest = min((r for r in rows if r["tool"] != "gwarchive"), key=lambda r: r["median"])
        lines += [
            "",
            f"## {w.title}",
            "",
            f"`{w.archive}`, {w.runs} runs.",
            "",
            "| tool | median | min | max | ratio to fastest peer | peak RSS |",
            "|---|---|---|---|---|---|",
        ]
        for r in sorted(rows, key=lambda r: r["median"]):
            lines.append(
                f"| {r['tool']} | {r['median']:.3f} s | {r['min']:.3f} s | {r['max']:.3f} s "
                f"| {r['median'] / fastest['median']:.2f} | {r['rss']:.1f} MiB |")
    if syscalls:
        lines += ["", "## System calls per extracted file", "",
                  "`strace -f -c` over one extraction of `small.zip` (20,000 files), all calls",
                  "of all threads divided by the number of files. Goal for gwarchive: at most 15.",
                  "", "| tool | calls per file |", "|---|---|"]
        lines += [f"| {tool} | {count:.1f} |" for tool, count in syscalls.items()]
    if remote and remote[0]:
        rows, header = remote
        lines += ["", "## Remote archives over 20 ms", "",
                  "bench/remote.sh: nginx in a network namespace, 20 ms added to every round trip;",
                  f"output to tmpfs on both sides; {' '.join(header)}.", "",
                  "| workload | local file | HTTP, no delay | HTTP, +20 ms | ratio to local "
                  "| requests (+20 ms) | goal |", "|---|---|---|---|---|---|---|"]
        for label, local, plain, plain_n, delayed, ratio, delayed_n in rows:
            kind, limit = REMOTE_GOALS[label]
            value = ratio if kind == "ratio" else delayed_n
            verdict = "met" if value <= limit else "not met"
            goal = f"≤ {limit}×" if kind == "ratio" else f"≤ {limit} requests"
            lines.append(f"| {label} | {local:.3f} s | {plain:.3f} s | {delayed:.3f} s | {ratio:.2f} "
                         f"| {delayed_n} | {goal}: {verdict} |")
    if notes:
        lines += ["", "## Notes", "", open(notes).read().strip()]
    with open(path, "w") as f:
        f.write("\n".join(lines) + "\n")


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("--build", required=True)
    parser.add_argument("--out", default=os.path.join(HERE, "RESULTS.md"))
    parser.add_argument("--notes", default=os.path.join(HERE, "NOTES.md"),
                        help="text appended to the results (explanations, profiles)")
    parser.add_argument("--only", default="", help="comma-separated workload names")
    parser.add_argument("--tool", help="the gwarchive to time (default: BUILD/gwarchive)")
    options = parser.parse_args()

    build = os.path.abspath(options.build)
    gw = os.path.abspath(options.tool) if options.tool else os.path.join(build, "gwarchive")
    corpus = os.path.join(build, "bench-corpus")
    scratch = os.path.join(build, "bench-scratch")
    for tool in ["hyperfine", "/usr/bin/time", "zip", "unzip", "bsdtar", "7zz", "unar", "lsar"]:
        if not shutil.which(tool):
            sys.exit(f"bench: {tool} is missing (scripts/install-deps.sh installs it)")
    subprocess.run([sys.executable, os.path.join(HERE, "corpus.py"), corpus], check=True)
    os.makedirs(scratch, exist_ok=True)

    selected = [w for w in workloads() if not options.only or w.name in options.only.split(",")]
    load_before = load_average()
    measured = [(w, run_workload(w, gw, corpus, scratch)) for w in selected]
    wanted = options.only.split(",") if options.only else []
    syscalls = syscalls_per_file(gw, corpus, scratch) if not wanted or "syscalls" in wanted else {}
    remote = remote_rows(build, gw) if not wanted or "remote" in wanted else None
    load_after = load_average()
    notes = options.notes if os.path.exists(options.notes) else None
    write_results(options.out, measured, load_before, load_after, notes, syscalls, remote)
    log(f"results in {options.out}")
    print(open(options.out).read())


if __name__ == "__main__":
    main()
