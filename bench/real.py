#!/usr/bin/env python3
"""Measures real programs with tally and by reading their smaps, and holds tally's figures against their page frames.

  real.py TALLY FRAMES [NAME ...]

TALLY is the tool, FRAMES the program of frames.cpp. NAMEs choose among the programs (all). Each is started on data made for
it, held still by SIGSTOP with all its processes, measured and ended. Prints a table; exit status 1 when a byte is wrong.
Root only.
"""
import ctypes, os, shutil, signal, sys, tempfile, time

import agreement
from measure import medians_of
from programs import PROGRAMS

MIB = 1 << 20


def parents():
    """The parent of every process."""
    found = {}
    for pid in (int(name) for name in os.listdir("/proc") if name.isdigit()):
        try:
            with open("/proc/%d/stat" % pid) as file:
                found[pid] = int(file.read().rpartition(")")[2].split()[1])
        except (FileNotFoundError, ProcessLookupError):
            pass  # has ended
    return found


def state(pid):
    with open("/proc/%d/stat" % pid) as file:
        return file.read().rpartition(")")[2].split()[0]


def descendants(root):
    """The process and all that descend from it, but those that have ended."""
    found, parent_of = [root], parents()
    for pid in found:
        found += [child for child, parent in parent_of.items() if parent == pid]
    return [pid for pid in found if state(pid) != "Z"]


def hold_still(root):
    """Stops the process and its descendants until no more of them appear. @return their pids"""
    stopped = []
    while True:
        running = [pid for pid in descendants(root) if pid not in stopped]
        if not running:
            return sorted(stopped)
        for pid in running:
            os.kill(pid, signal.SIGSTOP)
        while any(state(pid) not in "TZ" for pid in running):
            time.sleep(0.01)
        stopped += running


def end_all():
    """Ends what descends from this script; orphans are its children too, see main."""
    while True:
        for pid in descendants(os.getpid())[1:]:
            os.kill(pid, signal.SIGKILL)
        try:
            while os.waitpid(-1, os.WNOHANG)[0]:
                pass
        except ChildProcessError:
            return
        time.sleep(0.01)


def memory_of(pids):
    """Resident bytes, each page once."""
    total = 0
    for pid in pids:
        with open("/proc/%d/smaps_rollup" % pid) as file:
            total += sum(int(line.split()[1]) * 1024 for line in file if line.startswith("Pss:"))
    return total


def wanted(name, memory):
    return "1.0" if name == "browser" else "0.6" if memory >= 50 * MIB else "1.0 or 5 ms more"


def is_reached(name, memory, wall, base):
    most = 1.0 if name == "browser" else 0.6 if memory >= 50 * MIB else max(1.0, (base + 0.005) / base)
    return wall / base <= most


def measure(tally, frames, name, root):
    pids = hold_still(root)
    words = [word for pid in pids for word in ("--pid", str(pid))]
    medians = medians_of([("tally", [tally] + words), ("smaps", ["cat"] + ["/proc/%d/smaps" % pid for pid in pids])])
    (wall, spent), (base, base_spent) = medians["tally"], medians["smaps"]
    memory = memory_of(pids)
    comparison, walk = agreement.compare(tally, frames, pids)
    print("| %s | %d | %.0f MiB | %.1f ms | %.1f ms | %.2f | %s%s | %.1f ms | %.1f ms | %.2f | %d (%d) | %s |" %
          (name, len(pids), memory / MIB, wall * 1e3, base * 1e3, wall / base, wanted(name, memory),
           "" if is_reached(name, memory, wall, base) else " **missed**", spent * 1e3, base_spent * 1e3, spent / base_spent,
           comparison.sets, comparison.folded, "{:,}".format(sum(walk.anonymous.values())) if not comparison.differences else "**WRONG**"),
          flush=True)
    return comparison.differences


def run(tally, frames, name):
    folder = tempfile.mkdtemp(prefix="tally-real-")
    try:
        shutil.chown(folder, "nobody", "nogroup")
        return measure(tally, frames, name, PROGRAMS[name](folder).pid)
    finally:
        end_all()
        shutil.rmtree(folder, ignore_errors=True)


def main():
    tally, frames = (os.path.abspath(path) for path in sys.argv[1:3])
    # Orphans of the programs become children of this script, which ends them. A signal unwinds as an error does.
    set_child_subreaper = 36
    ctypes.CDLL(None).prctl(set_child_subreaper, 1, 0, 0, 0)
    for number in (signal.SIGINT, signal.SIGTERM, signal.SIGHUP):
        signal.signal(number, lambda number, _: sys.exit(128 + number))
    print("| program | processes | memory | tally, wall | smaps, wall | ratio | wanted | tally, processor | smaps, processor | "
          "ratio | exact sets (folded) | anonymous bytes, equal |\n|---|---|---|---|---|---|---|---|---|---|---|---|", flush=True)
    wrong = []
    for name in sys.argv[3:] or PROGRAMS:
        wrong += ["%s: %s" % (name, difference) for difference in run(tally, frames, name)]
    sys.exit("\n".join(wrong) or 0)


if __name__ == "__main__":
    main()
