#!/usr/bin/env python3
"""Turns Google Benchmark JSON files into docs/benchmarks.md.

Each target is a ratio of two measurements taken in the same run, so the
figures hold on any machine. A ratio whose benchmarks are missing is listed
as not measured rather than silently dropped.
"""
import glob
import json
import os
import platform
import sys

# (description, numerator, denominator, kind, target text, check)
# kind "time": ratio = time(denominator) / time(numerator) ... see below.
TARGETS = [
    ("Suppressed log line vs sent 100-character line (times cheaper)",
     "BM_HostLogSent100", "BM_HostLogSuppressed", "time_ratio", ">= 20", lambda r: r >= 20),
    ("stdout intake + read_line vs append+memchr baseline, 64 MiB (throughput ratio)",
     "BM_StdoutReadLine/64", "BM_BaselineAppendMemchr/64", "throughput_ratio", ">= 0.5", lambda r: r >= 0.5),
    ("stdout intake + read_line, 128 MiB time / 64 MiB time",
     "BM_StdoutReadLine/128", "BM_StdoutReadLine/64", "time_ratio", "1.8 .. 2.3",
     lambda r: 1.8 <= r <= 2.3),
    ("VerifyBundleChecksum vs md5sum on 1 GiB, warm cache (throughput ratio, best of 5 each)",
     "BM_ChecksumVersusMd5sum", "ratio_wall_best", "counter", ">= 0.9", lambda r: r >= 0.9),
    ("512 MiB download through sorvik-host vs the same curl command alone (throughput ratio, medians)",
     "BM_DownloadThroughHost", "BM_CurlDirect", "throughput_ratio", ">= 0.9", lambda r: r >= 0.9),
]


def load(directory):
    results = {}
    for path in glob.glob(os.path.join(directory, "*.json")):
        with open(path) as f:
            data = json.load(f)
        for b in data.get("benchmarks", []):
            name = b.get("run_name", b["name"])
            for suffix in ("/real_time", "/process_time", "/iterations", "/repeats", "/manual_time"):
                name = name.split(suffix)[0]
            # Repeated benchmarks are judged by their median.
            if b.get("run_type") == "aggregate":
                if b.get("aggregate_name") == "median":
                    results[name] = b
            elif results.get(name, {}).get("run_type") != "aggregate":
                results[name] = b
    return results


def seconds(b):
    unit = {"ns": 1e-9, "us": 1e-6, "ms": 1e-3, "s": 1.0}[b.get("time_unit", "ns")]
    return b["real_time"] * unit


def ratio(kind, a, b):
    if kind == "time_ratio":  # time(a) / time(b)
        return seconds(a) / seconds(b)
    if kind == "throughput_ratio":  # throughput(a) / throughput(b), same work
        ta = a.get("bytes_per_second") or 1.0 / seconds(a)
        tb = b.get("bytes_per_second") or 1.0 / seconds(b)
        return ta / tb
    raise ValueError(kind)


def main():
    results = load(sys.argv[1])
    print("# Benchmarks\n")
    print("Produced by `make bench` (Release build); every figure is a ratio of two")
    print("measurements taken in the same run on the same machine.\n")
    print(f"Machine: {platform.machine()}, {os.cpu_count()} cores, {platform.platform()}.\n")
    print("| Target | Measured | Goal | Met |")
    print("|---|---|---|---|")
    for desc, num, den, kind, goal, ok in TARGETS:
        if kind == "counter" and num in results and den in results[num]:
            r = results[num][den]
            print(f"| {desc} | {r:.2f} | {goal} | {'yes' if ok(r) else 'NO'} |")
        elif kind != "counter" and num in results and den in results:
            r = ratio(kind, results[num], results[den])
            print(f"| {desc} | {r:.2f} | {goal} | {'yes' if ok(r) else 'NO'} |")
        else:
            print(f"| {desc} | not measured | {goal} | - |")
    print("\n## Raw results\n")
    print("| Benchmark | Real time | Bytes/s |")
    print("|---|---|---|")
    for name in sorted(results):
        b = results[name]
        bps = b.get("bytes_per_second")
        print(f"| {name} | {b['real_time']:.4g} {b.get('time_unit', 'ns')} | "
              f"{bps / 1e6:.1f} MB/s |" if bps else f"| {name} | {b['real_time']:.4g} {b.get('time_unit', 'ns')} | |")


if __name__ == "__main__":
    main()
