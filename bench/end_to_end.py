#!/usr/bin/env python3
"""End-to-end migration speed: transvale against a bare-rename floor.

For each image size (applications with eight 4 KiB files each, one group per
ten applications, made once by devicegen), every timed run works on a fresh
copy made with `cp -a` outside the timed part. Each repetition runs, in turn:

  transvale, flush calls made no-ops (LD_PRELOAD of libqsbench_noflush.so)
  floor: the least work that carries the same data over (per application a
         bundle and a data container made, the bundles and the four data items
         renamed into them, the old container removed; each group's items
         moved into a new group container)
  transvale as it is (flushes included), for information
  floor that also flushes each new data and group container once
(the last two only for the sizes of --wall-sizes)

It reports (a) the work apart from flushes: medians of transvale without
flushes against the floor, their ratio and ms per application; (b) flushes and
system calls per application from one `strace -f -c` run of transvale, its
peak RSS, and the real wall times. Waiting for the disk is noisy on a shared
machine, the rest is not; hence the split and the medians of alternating runs.

  bench/end_to_end.py --build build [--sizes 100,1000,5000] [--repetitions 5]
      [--strace-sizes 100,1000] [--wall-sizes 100] [--work DIR] [--keep] [--json FILE]

The script also runs the floor itself: end_to_end.py floor ROOT [--flush].
"""

import argparse
import json
import os
import shutil
import statistics
import subprocess
import sys
import tempfile
import time
import uuid

FILES_PER_APP = 8
BYTES_PER_FILE = 4096
APPS_PER_GROUP = 10
SEED = 1
DEFAULT_SIZES = "100,1000,5000"
DEFAULT_REPETITIONS = 5

# The old layout devicegen writes and the new one the registry makes.
OLD_APPLICATIONS = "private/var/mobile/Applications"
OLD_GROUPS = "private/var/mobile/Library/AppGroups"
NEW_BUNDLES = "private/var/containers/Bundle/Application"
NEW_DATA = "private/var/mobile/Containers/Data/Application"
NEW_GROUPS = "private/var/mobile/Containers/Shared/AppGroup"
DATA_ITEMS = ("Documents", "Library", "tmp", "Tillbox")
BUNDLE_EXTENSIONS = (".app", ".vpnplugin")

FLUSH_CALLS = ("fsync", "fdatasync", "syncfs", "sync", "sync_file_range", "msync")
# System calls reported one by one (per application), by family.
CALL_FAMILIES = {
    "openat": ("openat", "open"),
    "stat": ("newfstatat", "statx", "fstat", "lstat", "stat"),
    "fcntl": ("fcntl",),
    "mkdir": ("mkdirat", "mkdir"),
    "rename": ("renameat2", "renameat", "rename"),
}

VARIANTS = ("transvale-noflush", "floor", "transvale", "floor-flush")


# --- the floor -------------------------------------------------------------------


def flush_directory(path):
    fd = os.open(path, os.O_RDONLY | os.O_DIRECTORY)
    try:
        os.fsync(fd)
    finally:
        os.close(fd)


def new_container(root, parent):
    path = os.path.join(root, parent, str(uuid.uuid4()).upper())
    os.mkdir(path, 0o755)
    return path


def floor(root, flush):
    for parent in (NEW_BUNDLES, NEW_DATA, NEW_GROUPS):
        os.makedirs(os.path.join(root, parent), exist_ok=True)
    applications = os.path.join(root, OLD_APPLICATIONS)
    for name in os.listdir(applications):
        old = os.path.join(applications, name)
        if not os.path.isdir(old):
            continue
        bundles = new_container(root, NEW_BUNDLES)
        data = new_container(root, NEW_DATA)
        for item in os.listdir(old):
            if item.endswith(BUNDLE_EXTENSIONS):
                os.rename(os.path.join(old, item), os.path.join(bundles, item))
        for item in DATA_ITEMS:
            try:
                os.rename(os.path.join(old, item), os.path.join(data, item))
            except FileNotFoundError:
                pass
        if flush:
            flush_directory(data)
        shutil.rmtree(old)
    groups = os.path.join(root, OLD_GROUPS)
    for name in os.listdir(groups):
        old = os.path.join(groups, name)
        new = new_container(root, NEW_GROUPS)
        for item in os.listdir(old):
            os.rename(os.path.join(old, item), os.path.join(new, item))
        if flush:
            flush_directory(new)
        os.rmdir(old)


# --- running ---------------------------------------------------------------------


class Tools:
    def __init__(self, build):
        self.build = os.path.abspath(build)
        self.transvale = os.path.join(self.build, "bin", "transvale")
        self.devicegen = os.path.join(self.build, "bin", "devicegen")
        self.noflush = os.path.join(self.build, "lib", "libqsbench_noflush.so")
        for path in (self.transvale, self.devicegen, self.noflush):
            if not os.path.exists(path):
                sys.exit(f"end_to_end.py: {path} is missing; build with -DQS_BUILD_BENCH=ON")


def run_measured(argv, env, log):
    """Runs argv to its end; (wall seconds, CPU seconds, peak RSS in KiB). Fails on a non-zero exit."""
    with open(log, "ab") as err:
        start = time.perf_counter()
        child = subprocess.Popen(argv, env=env, stdout=subprocess.DEVNULL, stderr=err)
        _, status, usage = os.wait4(child.pid, 0)
        elapsed = time.perf_counter() - start
        child.returncode = os.waitstatus_to_exitcode(status)
    if child.returncode != 0:
        sys.exit(f"end_to_end.py: {' '.join(argv)} exited with {child.returncode}; see {log}")
    return elapsed, usage.ru_utime + usage.ru_stime, usage.ru_maxrss


def run_root(work):
    return os.path.join(work, "run")


def remove_run(work):
    subprocess.run(["rm", "-rf", run_root(work)], check=True)


# The install map records absolute paths, so an image is made where its copies
# will run and kept aside; each copy goes back to that place.
def make_image(tools, work, size):
    image = os.path.join(work, f"image-{size}")
    if os.path.exists(os.path.join(image, "devicegen-manifest.plist")):
        return image
    shutil.rmtree(image, ignore_errors=True)
    remove_run(work)
    subprocess.run([tools.devicegen, "create", "--root", run_root(work), "--apps", str(size), "--groups",
                    str(size // APPS_PER_GROUP), "--files-per-app", str(FILES_PER_APP), "--bytes-per-file",
                    str(BYTES_PER_FILE), "--seed", str(SEED)], check=True, stdout=subprocess.DEVNULL)
    os.rename(run_root(work), image)
    return image


def fresh_copy(image, work):
    copy = run_root(work)
    remove_run(work)
    subprocess.run(["cp", "-a", "--reflink=never", image, copy], check=True)
    os.sync()  # the copy's own writeback is not the run's
    return copy


def command(tools, variant, root):
    env = dict(os.environ)
    env.pop("LD_PRELOAD", None)
    if variant.startswith("transvale"):
        argv = [tools.transvale, "--root", root, "--progress", "never"]
        if variant == "transvale-noflush":
            env["LD_PRELOAD"] = tools.noflush
    else:
        argv = [sys.executable, "-S", os.path.abspath(__file__), "floor", root]
        if variant == "floor-flush":
            argv.append("--flush")
    return argv, env


def verify(tools, root, log):
    with open(log, "ab") as out:
        if subprocess.run([tools.devicegen, "verify", "--root", root], stdout=out, stderr=out).returncode != 0:
            sys.exit(f"end_to_end.py: devicegen verify failed on {root}; see {log}")


def strace_counts(tools, root, work):
    """System calls of one transvale run, by name, from strace -f -c."""
    summary = os.path.join(work, "strace.txt")
    argv, env = command(tools, "transvale", root)
    subprocess.run(["strace", "-f", "-c", "-o", summary, "--"] + argv, env=env, check=True,
                   stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    counts = {}
    with open(summary) as lines:
        for line in lines:
            fields = line.split()
            # "% time  seconds  usecs/call  calls  [errors]  syscall"
            if len(fields) < 5 or not fields[0][0].isdigit() or fields[-1] == "total":
                continue
            counts[fields[-1]] = int(fields[3])
    return counts


def measure(tools, work, size, repetitions, with_strace, with_flushes, log):
    image = make_image(tools, work, size)
    variants = VARIANTS if with_flushes else VARIANTS[:2]
    times = {variant: [] for variant in variants}
    cpu = {variant: [] for variant in variants}
    peak_rss = 0
    for repetition in range(repetitions):
        for variant in variants:
            root = fresh_copy(image, work)
            argv, env = command(tools, variant, root)
            seconds, cpu_seconds, rss = run_measured(argv, env, log)
            times[variant].append(seconds)
            cpu[variant].append(cpu_seconds)
            if variant.startswith("transvale"):
                peak_rss = max(peak_rss, rss)
                if repetition == 0:
                    verify(tools, root, log)
            print(f"  {size} apps, run {repetition + 1}/{repetitions}, {variant}: {seconds * 1000:.0f} ms "
                  f"(CPU {cpu_seconds * 1000:.0f} ms)", file=sys.stderr)
    result = {"size": size, "times": times, "cpu": cpu, "peak_rss_kib": peak_rss}
    if with_strace:
        result["syscalls"] = strace_counts(tools, fresh_copy(image, work), work)
    remove_run(work)
    return result


# --- reporting -------------------------------------------------------------------


def report(results, repetitions):
    out = []
    out.append(f"(a) Work apart from flushes: medians of {repetitions} alternating runs on fresh copies, wall time "
               "and CPU time (user + system) of the process")
    out.append("")
    out.append("| Applications | transvale, no flushes | floor | ratio | transvale ms/app | floor ms/app "
               "| CPU: transvale | CPU: floor | CPU ratio |")
    out.append("|---:|---:|---:|---:|---:|---:|---:|---:|---:|")
    per_app = {}
    for r in results:
        n = r["size"]
        work = statistics.median(r["times"]["transvale-noflush"])
        bare = statistics.median(r["times"]["floor"])
        work_cpu = statistics.median(r["cpu"]["transvale-noflush"])
        bare_cpu = statistics.median(r["cpu"]["floor"])
        per_app[n] = work * 1000 / n
        out.append(f"| {n:,} | {work * 1000:.0f} ms | {bare * 1000:.0f} ms | {work / bare:.2f}x | "
                   f"{work * 1000 / n:.2f} | {bare * 1000 / n:.2f} | {work_cpu * 1000:.0f} ms | "
                   f"{bare_cpu * 1000:.0f} ms | {work_cpu / bare_cpu:.2f}x |")
    sizes = sorted(per_app)
    if len(sizes) > 1:
        out.append("")
        out.append(f"Linearity: transvale ms/app at {sizes[-1]:,} is {per_app[sizes[-1]] / per_app[sizes[-2]]:.2f}x "
                   f"the figure at {sizes[-2]:,}")
    out.append("")
    out.append("(b) System calls per application (strace -f -c, one transvale run), peak RSS")
    out.append("")
    out.append("| Applications | flushes | all calls | " + " | ".join(CALL_FAMILIES) + " | peak RSS |")
    out.append("|---:|---:|---:|" + "---:|" * len(CALL_FAMILIES) + "---:|")
    for r in results:
        n = r["size"]
        rss = f"{r['peak_rss_kib'] / 1024:.1f} MiB"
        if "syscalls" not in r:
            out.append(f"| {n:,} | | | " + " | " * len(CALL_FAMILIES) + f"{rss} |")
            continue
        calls = r["syscalls"]
        flushes = sum(calls.get(name, 0) for name in FLUSH_CALLS)
        families = [sum(calls.get(name, 0) for name in names) / n for names in CALL_FAMILIES.values()]
        out.append(f"| {n:,} | {flushes / n:.1f} | {sum(calls.values()) / n:.0f} | " +
                   " | ".join(f"{value:.1f}" for value in families) + f" | {rss} |")
    out.append("")
    out.append("For information, real wall time (flushes included), medians")
    out.append("")
    out.append("| Applications | transvale | floor with a flush per new container | ratio | transvale ms/app |")
    out.append("|---:|---:|---:|---:|---:|")
    for r in results:
        n = r["size"]
        if "transvale" not in r["times"]:
            continue
        real = statistics.median(r["times"]["transvale"])
        bare = statistics.median(r["times"]["floor-flush"])
        out.append(f"| {n:,} | {real * 1000:.0f} ms | {bare * 1000:.0f} ms | {real / bare:.2f}x | "
                   f"{real * 1000 / n:.2f} |")
    return "\n".join(out)


def main():
    if len(sys.argv) > 1 and sys.argv[1] == "floor":
        parser = argparse.ArgumentParser(prog="end_to_end.py floor")
        parser.add_argument("root")
        parser.add_argument("--flush", action="store_true")
        options = parser.parse_args(sys.argv[2:])
        floor(options.root, options.flush)
        return
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--build", default="build", help="build directory (default: build)")
    parser.add_argument("--sizes", default=DEFAULT_SIZES, help=f"applications per image (default: {DEFAULT_SIZES})")
    parser.add_argument("--repetitions", type=int, default=DEFAULT_REPETITIONS)
    parser.add_argument("--strace-sizes", default=None, help="sizes traced with strace (default: all)")
    parser.add_argument("--wall-sizes", default=None,
                        help="sizes also run with real flushes, for information (default: all)")
    parser.add_argument("--work", help="directory for images and runs (images are reused; default: a new one)")
    parser.add_argument("--keep", action="store_true", help="keep the work directory")
    parser.add_argument("--json", help="also write the raw figures here")
    options = parser.parse_args()
    tools = Tools(options.build)
    sizes = [int(s) for s in options.sizes.split(",")]
    traced = sizes if options.strace_sizes is None else [int(s) for s in options.strace_sizes.split(",") if s]
    flushed = sizes if options.wall_sizes is None else [int(s) for s in options.wall_sizes.split(",") if s]
    if traced and not shutil.which("strace"):
        sys.exit("end_to_end.py: strace is missing (apt-get install strace)")
    work = os.path.abspath(options.work) if options.work else tempfile.mkdtemp(prefix="qs-end-to-end-")
    os.makedirs(work, exist_ok=True)
    log = os.path.join(work, "runs.log")
    try:
        results = [measure(tools, work, n, options.repetitions, n in traced, n in flushed, log) for n in sizes]
    finally:
        if not options.keep and not options.work:
            shutil.rmtree(work, ignore_errors=True)
    if options.json:
        with open(options.json, "w") as out:
            json.dump(results, out, indent=1)
    print(report(results, options.repetitions))


if __name__ == "__main__":
    main()
