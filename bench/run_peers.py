#!/usr/bin/env python3
"""Runs the store against its peers and writes bench/RESULTS.md and bench/peers.png.

Every backend x workload x N runs in its own process of peers_benchmark (one
JSON line each). The store and raw SQLite run `--reps` times, back to back and
alternately (the order flips every repetition) so their ratio is measured on
the same machine state; the other backends run `--peer-reps` times. The
headline store / raw SQLite figure is the median of the ratios taken within
each repetition; elsewhere the best (lowest) processor time of the
repetitions is the figure reported.

    bench/run_peers.py --build build-peers                      # N = 100 000 and 1 000 000
    bench/run_peers.py --build build-peers --n 100000,4000000   # any sizes, 4 M among them
    bench/run_peers.py --build build-peers --big-n 10000000 \\
        --big-backends store,sqlite --big-workloads W1,W3,W4      # plus a 10 M subset
    bench/run_peers.py --build build-peers --render-only        # tables and chart again
    bench/run_peers.py --build build-peers --n 20000 --reps 1 --out /tmp/quick   # a quick look

Raw results accumulate in <build>/peers-results.jsonl (one line per process;
--fresh starts it over); with --out they go to <out>/peers-results.jsonl
instead, so a quick run leaves the real results and bench/RESULTS.md alone. Only the standard library is used; the chart needs
gnuplot (Debian gnuplot-nox) and is skipped with a message when it is missing.
"""

import argparse
import datetime
import json
import os
import platform
import shlex
import shutil
import statistics
import subprocess
import sys

WORKLOADS = {
    "W1": "sequential integer-key inserts, 100-byte data (ns/insert)",
    "W2": "the same integer keys in shuffled order (ns/insert)",
    "W3": "random 16-byte keys, 100-byte data (ns/insert)",
    "W4": "full ordered scans of W3, key and data read (ns/row)",
    "W5": "random point seeks of existing W3 keys, data read (ns/seek)",
    "W6": "prefix walk of 1 000 groups of composite keys (ns/entry walked)",
    "W6i": "key-only inserts of the W6 composite keys, random order (ns/insert; the fill phase of W6)",
    "W7": "read-modify-write counts of skewed keys, then a walk (ns/draw; N draws of 16-byte keys, "
          "each a lookup of the key's 8-byte count and a write of count + 1)",
}
ORDER = ["W1", "W2", "W3", "W4", "W5", "W6", "W6i", "W7"]
BACKEND_ORDER = ["store", "face", "sqlite", "map", "lmdb", "rocksdb"]
# Per-operation fields of a phase, recorded for the fill phase too (fill_<field>).
SPLIT_FIELDS = ["ns_user", "ns_sys", "reads_per_op", "writes_per_op", "read_bytes_per_op",
                "write_bytes_per_op"]
SETTINGS = {
    "store": "KovBtree / KovBtreeCursor on the library's own SQLite B-trees; one writing cursor "
             "per table; temporary file in KOV_TEMP; W7: seek, data() of the 8-byte count when "
             "found, insert of count + 1 on a BlobTable",
    "face": "the store through <kovpager/kovpager.hpp>: one table object; walks by range-for "
            "reading key() and data() in place, seeks by get_view() (the data in place); W7: "
            "get_view, then put",
    "sqlite": "hand-written SQL through the system's SQLite (Debian's libsqlite3): temporary "
              "database (empty name), page_size 4096, cache_size 16384 "
              "(64 MiB), journal_mode OFF, locking_mode EXCLUSIVE, synchronous OFF, one BEGIN "
              "EXCLUSIVE never committed, prepared statements, INSERT OR REPLACE (INSERT OR IGNORE "
              "on the key-only table); W7 counts with one prepared `INSERT INTO t(key, count) "
              "VALUES(?1, 1) ON CONFLICT(key) DO UPDATE SET count = count + 1` per draw on "
              "(key BLOB PRIMARY KEY, count INTEGER) WITHOUT ROWID",
    "map": "std::map / std::set in the heap, 100-byte std::array data: the in-memory ceiling; "
           "W7: find, then operator[] on a std::map of 8-byte counts",
    "lmdb": "64 GiB map (sparse), MDB_NOSYNC | MDB_WRITEMAP | MDB_NOMETASYNC, one write "
            "transaction for the run (aborted at the end), MDB_INTEGERKEY for integer keys; "
            "cache = the kernel's page cache; W7: mdb_get, then mdb_put",
    "rocksdb": "64 MiB LRU block cache, default write buffer (64 MiB) and background jobs, WAL "
               "disabled, no sync; integer keys as 8 big-endian bytes; W7: Get, then Put",
}


def paired_ratios(a_rows, b_rows, a, b, field="ns_cpu"):
    """a time / b time (`field`: processor or elapsed ns) for every repetition in which both
    ran."""
    pairs = {}
    for r in a_rows + b_rows:
        pairs.setdefault((r.get("invocation", ""), r.get("rep", 0)), {})[r["backend"]] = r
    return [p[a][field] / p[b][field] for p in pairs.values() if a in p and b in p]


def run_one(program, backend, workload, n, scratch):
    cmd = [program, "--backend", backend, "--workload", workload, "--n", str(n)]
    if scratch:
        cmd += ["--scratch", scratch]
    proc = subprocess.run(cmd, capture_output=True, text=True)
    if proc.returncode != 0:
        sys.stderr.write(f"FAILED: {' '.join(cmd)}\n{proc.stderr}\n")
        return None
    line = proc.stdout.strip().splitlines()[-1]
    return json.loads(line)


def measure(args, program, out_path):
    available = subprocess.run([program, "--list"], capture_output=True, text=True,
                               check=True).stdout.split()
    backends = [b for b in args.backends.split(",") if b in available]
    missing = [b for b in args.backends.split(",") if b not in available]
    if missing:
        print(f"not built, skipped: {', '.join(missing)}")
    plan = []  # (n, workload, [backends])
    for n in [int(x) for x in args.n.split(",") if x]:
        for w in args.workloads.split(","):
            plan.append((n, w, backends))
    if args.big_n:
        big = [b for b in args.big_backends.split(",") if b in available]
        for n in [int(x) for x in args.big_n.split(",") if x]:
            for w in args.big_workloads.split(","):
                plan.append((n, w, big))
    invocation = datetime.datetime.now().isoformat(timespec="seconds")
    tree = source_tree()
    with open(out_path, "a") as out:
        for n, w, names in plan:
            # The store and raw SQLite run back to back in every repetition, their order flipping;
            # so do the face, the store's copying members and LMDB when the face is measured.
            pairs = ("store", "sqlite", "face", "lmdb") if "face" in names else ("store", "sqlite")
            paired = [b for b in pairs if b in names]
            others = [b for b in names if b not in paired]
            for rep in range(max(args.reps, args.peer_reps)):
                order = []
                if rep < args.reps:
                    order += paired if rep % 2 == 0 else list(reversed(paired))
                if rep < args.peer_reps:
                    order += others
                for b in order:
                    r = run_one(program, b, w, n, args.scratch)
                    if r is None:
                        continue
                    r["rep"] = rep
                    r["invocation"] = invocation
                    r["tree"] = tree
                    r["time"] = datetime.datetime.now().isoformat(timespec="seconds")
                    out.write(json.dumps(r) + "\n")
                    out.flush()
                    print(f"{w:3} n={n:<9} {b:8} rep {rep}: {r['ns_cpu']:10.1f} ns/op cpu "
                          f"{r['ns_wall']:10.1f} wall  rss {r['peak_rss_kib'] / 1024:7.1f} MiB "
                          f"disk {r['disk_bytes'] / 2**20:8.1f} MiB", flush=True)


def source_tree():
    """HEAD of the source tree when the run starts (read-only git calls): rebuild first."""
    top = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
    try:
        rev = subprocess.run(["git", "-C", top, "rev-parse", "--short", "HEAD"],
                             capture_output=True, text=True).stdout.strip()
        dirty = subprocess.run(["git", "-C", top, "diff", "--quiet", "HEAD", "--", "engine",
                                "pager", "bench", "CMakeLists.txt"]).returncode != 0
    except OSError:
        return "?"
    return (rev or "?") + ("+changes" if dirty else "")


def load(path):
    rows = []
    with open(path) as f:
        for line in f:
            line = line.strip()
            if line:
                rows.append(json.loads(line))
    # the fill phase of W6 is a workload of its own in the tables: W6i.
    extra = []
    for r in rows:
        if r["workload"] == "W6":
            e = dict(r)
            e["workload"] = "W6i"
            e["ns_cpu"] = r["fill_ns_cpu"]
            e["ns_wall"] = r["fill_ns_wall"]
            e["ops"] = r["n"]
            for field in SPLIT_FIELDS:
                e[field] = r.get("fill_" + field)  # None from runs that did not record it
            extra.append(e)
    return rows + extra


def fmt_ns(v):
    if v is None:
        return "-"
    if v >= 100:
        return f"{v:,.0f}"
    return f"{v:.1f}"


def fmt_n(n):
    if n >= 1000000 and n % 1000000 == 0:
        return f"{n // 1000000} M"
    if n >= 1000 and n % 1000 == 0:
        return f"{n // 1000} k"
    return str(n)


def md_table(header, align, rows):
    """The lines of a Markdown table: the header cells, each column's alignment ("---" or "---:")
    and the rows' cells."""
    lines = ["| " + " | ".join(header) + " |", "|" + "".join(a + "|" for a in align)]
    lines += ["| " + " | ".join(cells) + " |" for cells in rows]
    return lines


def per_workload_table(workloads, ns, backends, shown, cell):
    """A table with a row per workload and N that `shown(w, n)` keeps, a column per backend and
    `cell(w, n, b)` in it."""
    rows = [[w, fmt_n(n)] + [cell(w, n, b) for b in backends]
            for w in workloads for n in ns if shown(w, n)]
    return md_table(["workload", "N"] + backends, ["---", "---:"] + ["---:"] * len(backends), rows)


def per_backend_table(rows, ns, backends, cell):
    """A table with a row per backend and a column per N: `cell(results)` of that backend's
    results at that N, "-" where it gives None."""
    return md_table(["backend"] + [f"N={fmt_n(n)}" for n in ns], ["---"] + ["---:"] * len(ns),
                    [[b] + [cell([r for r in rows if r["backend"] == b and r["n"] == n]) or "-"
                            for n in ns] for b in backends])


def tally_mismatches(rows, ns):
    """The workloads and sizes whose read tallies differ across backends (W7: or whose counts do
    not add up to N)."""
    bad = []
    for w in ("W4", "W5", "W6", "W7"):
        for n in ns:
            tallies = {(r["rows"], r["sum"]) for r in rows if r["workload"] == w and r["n"] == n}
            if len(tallies) > 1 or (w == "W7" and any(s != n for _, s in tallies)):
                bad.append(f"{w} N={fmt_n(n)}")
    return bad


def machine():
    model = "?"
    try:
        with open("/proc/cpuinfo") as f:
            for line in f:
                if line.startswith("model name"):
                    model = line.split(":", 1)[1].strip()
                    break
    except OSError:
        pass
    mem = "?"
    try:
        with open("/proc/meminfo") as f:
            for line in f:
                if line.startswith("MemTotal"):
                    mem = f"{int(line.split()[1]) / 2**20:.1f} GiB"
    except OSError:
        pass
    versions = []
    for pkg in ("libsqlite3-0", "liblmdb0", "librocksdb7.8", "g++"):
        try:
            v = subprocess.run(["dpkg-query", "-W", "-f=${Version}", pkg], capture_output=True,
                               text=True).stdout.strip()
            if v:
                versions.append(f"{pkg} {v}")
        except OSError:
            pass
    return model, mem, versions


def render(args, rows, results_md, chart_png, command):
    by = {}  # (w, n, backend) -> list of results
    for r in rows:
        by.setdefault((r["workload"], r["n"], r["backend"]), []).append(r)
    best = {k: min(v, key=lambda r: r["ns_cpu"]) for k, v in by.items()}
    ns = sorted({r["n"] for r in rows})
    backends = [b for b in BACKEND_ORDER if any(r["backend"] == b for r in rows)]
    workloads = [w for w in ORDER if any(r["workload"] == w for r in rows)]

    model, mem, versions = machine()
    L = []
    L.append("# The store against its peers")
    L.append("")
    L.append("Generated by `bench/run_peers.py`; do not edit by hand. Each figure is one process "
             "running one workload on one backend (`peers_benchmark --backend B --workload W --n "
             "N`); times are **processor nanoseconds per operation** of the whole process (user "
             "+ system, all threads: RocksDB's background flushes and compactions are charged to "
             "it), the best of the repetitions. The machine is shared with other engineers' "
             "builds, so the ratios measured back to back matter more than the absolute numbers.")
    L.append("")
    L.append("## Machine and command")
    L.append("")
    L.append(f"- {os.cpu_count()} processors (nproc), {model}, {mem} memory, "
             f"{platform.system()} {platform.release()}")
    L.append(f"- {', '.join(versions)}")
    L.append(f"- written {datetime.datetime.now().isoformat(timespec='minutes')}; commands run: "
             f"`{command}`")
    reps = {}
    for r in rows:
        reps.setdefault(r["backend"], []).append((r["workload"], r["n"]))
    counts = {b: f"{len(v) / len(set(v)):.1f}".rstrip("0").rstrip(".") for b, v in reps.items()}
    trees = sorted({r.get("tree", "?") for r in rows})
    L.append("- source trees measured: " + ", ".join(f"`{t}`" for t in trees) +
             (" (see the notes under the tables)" if len(trees) > 1 else ""))
    L.append("- repetitions per figure (mean): " + ", ".join(f"{b} {counts[b]}" for b in backends) +
             " (store and raw SQLite alternate, their order flipping every repetition)")
    L.append("")
    L.append("## Workloads")
    L.append("")
    for w in workloads:
        L.append(f"- **{w}** {WORKLOADS[w]}")
    L.append("- W4 and W5 first fill W3's table in the same process (not timed in their figure); "
             "W5 makes rounds of max(N/10, min(N, 100 000)) seeks. The read phase of W4, W5 and "
             "W6 is made again until it has taken 0.2 s of processor time (one pass of a 100 k "
             "table takes a few ms, too short for a shared machine), and the figure is per "
             "operation over all the passes. Keys are computed on the fly, so no process holds "
             "a copy of the workload; the key computation (a few ns) is inside every timing, "
             "for every backend alike.")
    L.append("- Every insert phase (W1, W2, W3, the fills of W4, W5 and W6, W7's draws) ends "
             "inside its timing with the entries read back: the first entry in key order and a "
             "lookup of the last key inserted, which must be found. A backend that defers work "
             "until the next read pays for it in the workload that caused it.")
    L.append("- W7 draws key ranks r = floor((N+1)^u) - 1, u uniform in [0, 1): P(r) = "
             "ln((r+2)/(r+1)) / ln(N+1), Zipf's law with exponent 1 over N distinct keys (the "
             "hottest takes about 5 % of the draws). About a fifth to a quarter of the keys "
             "come up (25 k at N = 100 k, 223 k at 1 M, 836 k at 4 M, 2.0 M at 10 M). The "
             "final walk reads every count in key order and is inside the timing; its tally "
             "(rows, sum of counts = N) must agree across backends.")
    L.append("")
    L.append("## Backends and their memory settings")
    L.append("")
    for b in backends:
        L.append(f"- **{b}**: {SETTINGS[b]}")
    L.append("")

    # Headline: store vs raw SQLite.
    L.append("## Headline: the store / raw SQLite")
    L.append("")
    L.append("Paired = the median over the repetitions of store time / raw time (processor "
             "time), each ratio taken within one repetition, where the two ran back to back "
             "(their order flipping every repetition): the figure to quote. Best-of = best "
             "store time / best raw time, beside it. Wall = the paired median on elapsed time.")
    L.append("")
    headline = []
    for w in workloads:
        cells = []
        for n in ns:
            s = by.get((w, n, "store"))
            q = by.get((w, n, "sqlite"))
            if not s or not q:
                cells += ["-", "-", "-"]
                continue
            bs = best[(w, n, "store")]
            bq = best[(w, n, "sqlite")]
            ratio = bs["ns_cpu"] / bq["ns_cpu"]
            paired = paired_ratios(s, q, "store", "sqlite")
            wall = paired_ratios(s, q, "store", "sqlite", "ns_wall")
            cells += [f"**{statistics.median(paired):.2f}**" if paired else "-", f"{ratio:.2f}",
                      f"{statistics.median(wall):.2f}" if wall else "-"]
        headline.append([w] + cells)
    L += md_table(["workload"] + [f"N={fmt_n(n)} paired | best-of | wall" for n in ns],
                  ["---"] + ["---:"] * (3 * len(ns)), headline)
    L.append("")

    # ns/op per workload / backend / N.
    L.append("## Processor ns per operation (best of repetitions)")
    L.append("")
    L += per_workload_table(
        workloads, ns, backends, lambda w, n: any((w, n, b) in best for b in backends),
        lambda w, n, b: fmt_ns(best[(w, n, b)]["ns_cpu"]) if (w, n, b) in best else "-")
    L.append("")
    L.append("## Ratio to raw SQLite (processor time, best of repetitions; below 1 is faster)")
    L.append("")
    L += per_workload_table(
        workloads, ns, backends, lambda w, n: (w, n, "sqlite") in best,
        lambda w, n, b: f"{best[(w, n, b)]['ns_cpu'] / best[(w, n, 'sqlite')]['ns_cpu']:.2f}"
        if (w, n, b) in best else "-")
    L.append("")
    L.append("## Elapsed ns per operation (best of repetitions)")
    L.append("")
    L += per_workload_table(
        workloads, ns, backends, lambda w, n: any((w, n, b) in by for b in backends),
        lambda w, n, b: fmt_ns(min(r["ns_wall"] for r in by[(w, n, b)])) if (w, n, b) in by
        else "-")
    L.append("")

    # The face against LMDB and against the store's copying members, paired.
    face_pairs = [(a, b) for a, b in (("face", "lmdb"), ("face", "store"))
                  if any((w, n, a) in by and (w, n, b) in by for w in workloads for n in ns)]
    if face_pairs:
        L.append("## The face (<kovpager/kovpager.hpp>) against LMDB and the copying members")
        L.append("")
        L.append("Paired medians of face time / other time (processor time), each ratio taken "
                 "within one repetition where the two ran back to back: at or below 1 the face "
                 "is as fast or faster.")
        L.append("")
        face_ns = [n for n in ns if any((w, n, "face") in by for w in workloads)]
        cells = []
        for w in workloads:
            row = [w]
            for n in face_ns:
                for a, b in face_pairs:
                    ratios = paired_ratios(by.get((w, n, a), []), by.get((w, n, b), []), a, b)
                    row.append(f"**{statistics.median(ratios):.2f}**" if ratios else "-")
            if any(c != "-" for c in row[1:]):
                cells.append(row)
        names = {"lmdb": "LMDB", "store": "copying"}
        L += md_table(["workload"] + [f"N={fmt_n(n)} / {names[b]}" for n in face_ns
                                      for _, b in face_pairs],
                      ["---"] + ["---:"] * (len(face_ns) * len(face_pairs)), cells)
        L.append("")

    # The store against LMDB and RocksDB.
    peers = [b for b in ("lmdb", "rocksdb") if b in backends]
    if peers:
        names = {"lmdb": "LMDB", "rocksdb": "RocksDB"}
        L.append("## The store against " + " and ".join(names[b] for b in peers) +
                 " (processor time, best of repetitions)")
        L.append("")
        L.append("Store time / peer time: at or below 1 the store is as fast as the peer or "
                 "faster.")
        L.append("")
        peer_ns = [n for n in ns if any((w, n, b) in best for w in workloads for b in peers)]
        cells = []
        for w in workloads:
            cells.append([w])
            for n in peer_ns:
                for b in peers:
                    s_, p_ = best.get((w, n, "store")), best.get((w, n, b))
                    cells[-1].append(f"{s_['ns_cpu'] / p_['ns_cpu']:.2f}" if s_ and p_ else "-")
        L += md_table(["workload"] + [f"N={fmt_n(n)} {names[b]}" for n in peer_ns for b in peers],
                      ["---"] + ["---:"] * (len(peer_ns) * len(peers)), cells)
        L.append("")

    # Where the processor time goes, and the temporary file's system calls.
    split = [r for r in rows if r.get("ns_sys") is not None]
    if split:
        L.append("## Where the time goes, per workload and backend")
        L.append("")
        L.append("Per operation of the measured phase, from the run with the best processor "
                 "time: user and kernel processor ns (getrusage), and the read and write system "
                 "calls with the KiB they moved (/proc/self/io): for the store and raw SQLite "
                 "those on the temporary file (below the cache nothing goes to it), for RocksDB "
                 "those of its files and background threads; LMDB writes through its memory "
                 "map, which no system call counts. Peak RSS: that run's peak resident set "
                 "(MiB, getrusage ru_maxrss, the whole process: for W4, W5 and W6 the fill "
                 "included).")
        L.append("")
        cells = []
        for w in workloads:
            for n in ns:
                for b in backends:
                    cands = [r for r in split if r["workload"] == w and r["n"] == n and
                             r["backend"] == b]
                    if not cands:
                        continue
                    r = min(cands, key=lambda r: r["ns_cpu"])
                    cells.append([w, fmt_n(n), b, fmt_ns(r["ns_user"]), fmt_ns(r["ns_sys"]),
                                  f"{r['reads_per_op']:.2f}",
                                  f"{r['read_bytes_per_op'] / 1024:.1f}",
                                  f"{r['writes_per_op']:.2f}",
                                  f"{r['write_bytes_per_op'] / 1024:.1f}",
                                  f"{r['peak_rss_kib'] / 1024:.0f}"])
        L += md_table(["workload", "N", "backend", "user ns", "kernel ns", "reads", "KiB read",
                       "writes", "KiB written", "peak RSS"],
                      ["---", "---:", "---"] + ["---:"] * 7, cells)
        L.append("")

    # Memory and disk.
    L.append("## Peak memory (MiB, getrusage ru_maxrss, largest over the workloads run)")
    L.append("")
    L.append("Includes the program itself (about 12 MiB before any work). LMDB's figure counts "
             "the pages of its memory map that the process touched.")
    L.append("")
    L += per_backend_table(
        rows, ns, backends,
        lambda rs: f"{max(r['peak_rss_kib'] for r in rs) / 1024:.0f}" if rs else None)
    L.append("")
    L.append("## Temporary disk in use at the end (MiB of allocated blocks, largest over the "
             "workloads run)")
    L.append("")
    L.append("Files under the backend's scratch directory, plus the unlinked temporary file that "
             "SQLite keeps open (found through /proc/self/fd). The SQLite file exists only once "
             "the 64 MiB cache spills.")
    L.append("")
    L += per_backend_table(
        rows, ns, backends,
        lambda rs: f"{max(r['disk_bytes'] for r in rs) / 2**20:.0f}" if rs else None)
    L.append("")

    # Cross-check of the read tallies.
    bad = tally_mismatches(rows, ns)
    missing = [r for r in rows if r.get("missing", 0)]
    L.append("## Checks")
    L.append("")
    if bad or missing:
        L.append(f"- **MISMATCH**: read tallies differ across backends for {', '.join(bad)}; "
                 f"{len(missing)} runs had seeks that found nothing.")
    else:
        L.append("- Every backend read the same rows with the same checksum in W4, W5 and W6, "
                 "counted the same keys with counts adding up to N in W7, and every seek found "
                 "its key.")
    L.append("")
    if len({r.get("tree", "?") for r in rows}) > 1:
        L.append("## Notes: which source tree each figure comes from")
        L.append("")
        groups = {}
        for r in rows:
            if r["workload"] == "W6i":
                continue
            groups.setdefault(r.get("tree", "?"), set()).add(
                (r["n"], r["workload"], r["backend"]))
        for tree, items in sorted(groups.items()):
            parts = {}
            for n, w, b in items:
                parts.setdefault((n, b), []).append(w)
            text = "; ".join(f"N={fmt_n(n)} {b}: {','.join(sorted(ws))}"
                             for (n, b), ws in sorted(parts.items()))
            L.append(f"- `{tree}`: {text}")
        L.append("")
    L.append("![ns/op against N](peers.png)")
    L.append("")
    with open(results_md, "w") as f:
        f.write("\n".join(L))
    print(f"wrote {results_md}")

    chart(best, ns, backends, workloads, chart_png, args)


def chart(best, ns, backends, workloads, chart_png, args):
    gnuplot = shutil.which("gnuplot")
    if gnuplot is None:
        print("gnuplot not found (Debian: gnuplot-nox): no chart")
        return
    datadir = os.path.join(args.build, "peers-plot")
    os.makedirs(datadir, exist_ok=True)
    script = [
        "set terminal pngcairo size 1600,900 font ',10'",
        f"set output '{os.path.abspath(chart_png)}'",
        "set multiplot layout 2,4 title 'ns per operation (processor time) against N' "
        "font ',13'",
        "set logscale xy", "set grid", "set key top left font ',8'",
        "set xlabel 'N'", "set ylabel 'ns/op'", "set format x '10^{%L}'",
    ]
    styles = {"store": "lw 3 lc rgb '#d62728' pt 7", "face": "lw 2 lc rgb '#ff7f0e' pt 7 dt 3",
              "sqlite": "lw 2 lc rgb '#1f77b4' pt 5",
              "map": "lw 1 lc rgb '#7f7f7f' pt 9 dt 2", "lmdb": "lw 2 lc rgb '#2ca02c' pt 11",
              "rocksdb": "lw 2 lc rgb '#9467bd' pt 13"}
    for w in workloads:
        plots = []
        for b in backends:
            pts = [(n, best[(w, n, b)]["ns_cpu"]) for n in ns if (w, n, b) in best]
            if not pts:
                continue
            path = os.path.join(datadir, f"{w}-{b}.dat")
            with open(path, "w") as f:
                for n, v in pts:
                    f.write(f"{n} {v}\n")
            plots.append(f"'{path}' using 1:2 with linespoints title '{b}' "
                         f"{styles.get(b, '')}")
        if plots:
            title = f"{w}: {WORKLOADS[w].split(' (')[0]}".replace("'", "''")  # gnuplot quoting
            script.append(f"set title '{title}' font ',9'")
            script.append("plot " + ", ".join(plots))
    script.append("unset multiplot")
    path = os.path.join(datadir, "peers.gp")
    with open(path, "w") as f:
        f.write("\n".join(script) + "\n")
    subprocess.run([gnuplot, path], check=True)
    print(f"wrote {chart_png}")


def main():
    here = os.path.dirname(os.path.abspath(__file__))
    p = argparse.ArgumentParser(description=__doc__.split("\n")[0])
    p.add_argument("--build", default=os.path.join(os.path.dirname(here), "build"),
                   help="build directory holding bench/peers_benchmark")
    p.add_argument("--n", default="100000,1000000", help="workload sizes, comma separated")
    p.add_argument("--backends", default=",".join(BACKEND_ORDER))
    p.add_argument("--workloads", default="W1,W2,W3,W4,W5,W6,W7")
    p.add_argument("--big-n", default="", help="extra sizes run only on --big-backends")
    p.add_argument("--big-backends", default="store,sqlite")
    p.add_argument("--big-workloads", default="W1,W3,W4")
    p.add_argument("--reps", type=int, default=3, help="repetitions of store and raw SQLite")
    p.add_argument("--peer-reps", type=int, default=1, help="repetitions of the other backends")
    p.add_argument("--scratch", default="", help="scratch root (default: beside the program)")
    p.add_argument("--fresh", action="store_true", help="start the results file over")
    p.add_argument("--render-only", action="store_true", help="only rewrite the report")
    p.add_argument("--results", default="",
                   help="results file (default: <out>/peers-results.jsonl with --out, otherwise "
                        "<build>/peers-results.jsonl)")
    p.add_argument("--out", default="",
                   help="where RESULTS.md and peers.png go (default: bench/, the published ones)")
    args = p.parse_args()
    args.build = os.path.abspath(args.build)
    program = os.path.join(args.build, "bench", "peers_benchmark")
    if args.out:
        os.makedirs(args.out, exist_ok=True)
    results = args.results or os.path.join(args.out or args.build, "peers-results.jsonl")
    args.out = args.out or here
    command = shlex.join(["bench/run_peers.py"] + sys.argv[1:])
    if not args.render_only:
        if not os.access(program, os.X_OK):
            sys.exit(f"{program} not built (cmake --build {args.build} --target peers_benchmark)")
        if args.fresh:
            for path in (results, results + ".commands"):
                if os.path.exists(path):
                    os.remove(path)
        with open(results + ".commands", "a") as f:
            f.write(command + "\n")
        measure(args, program, results)
    rows = load(results)
    if os.path.exists(results + ".commands"):
        with open(results + ".commands") as f:
            command = "`; `".join(line.strip() for line in f if line.strip())
    if not rows:
        sys.exit("no results")
    render(args, rows, os.path.join(args.out, "RESULTS.md"), os.path.join(args.out, "peers.png"),
           command)


if __name__ == "__main__":
    main()
