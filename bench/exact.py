#!/usr/bin/env python3
"""Holds tally's figures against a population whose truth is known, and against the machine's own counters.

  exact.py TALLY [--overlay] [--no-counters] [ARGUMENT OF population.py ...]

Starts population.py with its extras and compares, to the byte: the bytes of each exact set of holders, in both views; what
five children of one family hold between them; what is held and not mapped. Then, unless others keep the machine busy, what
the population added to the sum over all processes with what it added to /proc/meminfo, within the part given below. With
--overlay all of it happens in an overlay over the root file system, as in a container. Exit status 1 on a difference, 77
where a user may not do this.
"""
import collections, json, os, shutil, subprocess, sys, tempfile

HERE = os.path.dirname(os.path.abspath(__file__))
MIB = 1 << 20


def meminfo():
    with open("/proc/sys/vm/stat_refresh", "w") as file:
        file.write("1")
    with open("/proc/meminfo") as file:
        return {line.split(":")[0]: int(line.split()[1]) * 1024 for line in file}


class Report:
    """The document of one run."""

    def __init__(self, tally, arguments):
        with tempfile.NamedTemporaryFile(dir="/dev/shm") as file:
            subprocess.run([tally, "-v", "-j", file.name] + arguments, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
            self.document = json.load(file)
        self.regions = {process["pid"]: process.get("regions", []) for process in self.document["processes"]}

    def sets(self, places, figure):
        """Bytes of `figure` by exact set of holders; `places` are (pid, address, size)."""
        objects = collections.defaultdict(collections.Counter)
        for pid, address, size in places:
            for region in self.regions.get(pid, []):
                if "addr" in region and address <= region["addr"] < address + size:
                    objects[region["id"]][pid] += sum(region.get(name, 0) for name in figure)
        sets = collections.Counter()
        for holders in objects.values():
            sizes = {size for size in holders.values() if size}
            if len(sizes) > 1:
                return {"one object in different sizes": sizes}
            if sizes:
                sets[tuple(sorted(pid for pid, size in holders.items() if size))] += sizes.pop()
        return dict(sets)

    def unmapped(self, pid):
        """Sizes of what the process holds and does not map, page tables left out."""
        return sorted(region["dirty"] for region in self.regions[pid]
                      if "addr" not in region and region["name"] != "page table" and region.get("dirty"))

    def summary(self, figure, *names):
        return sum(row[figure] for name, row in self.document["summary"].items()
                   if name != "total" and (not names or name.startswith(names)))


class Verdicts:
    def __init__(self):
        self.failed = 0

    def equal(self, what, measured, expected):
        self.say(what, measured == expected, "" if measured == expected else "%s, expected %s" % (measured, expected))

    def near(self, what, measured, expected, part):
        allowed = max(expected * part, MIB)
        self.say(what, abs(measured - expected) <= allowed,
                 "%d of %d bytes: %+.3f %%" % (measured, expected, 100 * (measured - expected) / max(expected, 1)))

    def say(self, what, is_right, text):
        self.failed += not is_right
        print("%-7s %s%s" % ("right" if is_right else "WRONG", what, ": " + text if text else ""), flush=True)


ANY = ("dirty", "swapped", "reclaimable")


def compare_sets(verdicts, title, report, truth):
    for family in truth["families"]:
        everyone = [family["leader"]] + family["children"]
        expected = {tuple(sorted(each["pids"])): each["bytes"] for each in family["exact_sets"]}
        verdicts.equal("%s, family '%s' of %d, %d sets" % (title, family["kind"], len(everyone), len(expected)),
                       report.sets([(pid, family["addr"], family["size"]) for pid in everyone], ANY), expected)
    shared = truth["shm"]
    verdicts.equal(title + ", shared memory of five",
                   report.sets([(pid, address, shared["true_bytes"]) for pid, address in zip(shared["pids"], shared["addrs"])], ANY),
                   {tuple(sorted(shared["pids"])): shared["true_bytes"]})
    big = truth["big"]
    verdicts.equal(title + ", one big process", report.sets([(big["pid"], big["addr"], big["true_bytes"])], ANY),
                   {(big["pid"],): big["true_bytes"]})


def compare_extras(verdicts, default, objects, extras):
    pid = extras["pid"]
    for name, figure in [("shared_anon_3", ANY), ("lazyfree_forked_3", ("reclaimable",)), ("mlocked_forked_3", ("dirty",)),
                         ("lazyfree", ("reclaimable",)), ("mlocked", ("wired",)), ("zero_page_reads", ANY),
                         ("untouched_reservation", ANY)]:
        extra = extras[name]
        holders = extra.get("pids", [pid])
        expected = {tuple(sorted(holders)): extra["bytes"]} if extra["bytes"] else {}
        places = [(holder, extra["addr"], extra.get("mapped", extra["bytes"])) for holder in holders]
        verdicts.equal(name, default.sets(places, figure), expected)
    half = extras["memfd_half_touched"]
    place = [(pid, half["addr"], half["bytes"])]
    verdicts.equal("memfd_half_touched, charged", default.sets(place, ANY), {(pid,): half["touched"]})
    verdicts.equal("memfd_half_touched, by object", objects.sets(place, ANY), {(pid,): half["bytes"]})
    twice = extras["mapped_twice_same_process"]
    places = [(pid, twice[name], twice["bytes"]) for name in ("addr", "addr2")]
    verdicts.equal("mapped_twice_same_process", default.sets(places, ANY), {(pid,): twice["bytes"]})
    verdicts.equal("held and not mapped", default.unmapped(pid),
                   sorted(extras[name]["bytes"] for name in ("memfd_unmapped", "tmpfs_deleted_unmapped", "sysv_detached")))


def figures_of(default, objects):
    """What is compared with the machine's counters."""
    tables = default.summary("dirty", "page table")
    unmapped = default.summary("dirty", "Owned physical tally (unmapped)")
    file_and_shared = default.summary("dirty", "shared memory", "mapped file", "Owned physical tally (unmapped)")
    shared = objects.summary("dirty", "shared memory", "mapped file") + unmapped
    return {"AnonPages": default.summary("dirty") - tables - file_and_shared + default.summary("reclaimable"),
            "Shmem": shared, "PageTables": tables}


def views(tally):
    return Report(tally, ["-a", "-x", "kernel"]), Report(tally, ["-a", "-x", "kernel", "--vmObjectDirty"])


def run_in_overlay(words):
    """Runs this script again where an overlay is the root file system, in a mount namespace that ends with it."""
    folder = tempfile.mkdtemp(dir=os.path.dirname(words[0]))  # a disk's, where the programs are
    script = """mkdir upper work root && mount -t overlay overlay -o lowerdir=/,upperdir=upper,workdir=work root || exit 77
                for name in proc sys dev dev/shm; do mount --bind /$name root/$name || exit 77; done
                exec chroot root "$@" """
    try:
        return subprocess.run(["unshare", "-m", "sh", "-c", script, "sh", sys.executable, os.path.abspath(__file__)] + words,
                              cwd=folder).returncode
    finally:
        shutil.rmtree(folder, ignore_errors=True)


def main():
    tally, arguments = os.path.abspath(sys.argv[1]), sys.argv[2:]
    if os.geteuid() != 0:
        print("skipped: all processes are measured by root only")
        return 77
    if "--overlay" in arguments:
        return run_in_overlay([tally] + [word for word in arguments if word != "--overlay"])
    counts = "--no-counters" not in arguments
    verdicts = Verdicts()
    if counts:
        counters_before, before = meminfo(), figures_of(*views(tally))
    population = subprocess.Popen([sys.executable, os.path.join(HERE, "population.py"), "--seconds", "500", "--extras"] +
                                  [word for word in arguments if word != "--no-counters"], stdout=subprocess.PIPE, text=True)
    try:
        text = ""
        for line in population.stdout:
            text += line
            if line.startswith("}"):
                break
        truth = json.loads(text)
        counters, (default, objects) = meminfo(), views(tally)
        compare_sets(verdicts, "charged", default, truth)
        compare_sets(verdicts, "by object", objects, truth)
        compare_extras(verdicts, default, objects, truth["extras"])
        pure = truth["families"][0]
        five = pure["children"][:5]
        arguments = [word for pid in five for word in ("--pid", str(pid))]
        verdicts.equal("five children as the only targets", Report(tally, arguments).sets(
            [(pid, pure["addr"], pure["size"]) for pid in five], ANY), {tuple(sorted(five)): pure["size"]})
        now = figures_of(default, objects) if counts else {}
        for counter, part in [("AnonPages", 0.001), ("Shmem", 0.005), ("PageTables", 0.03)] if counts else []:
            verdicts.near("increase of " + counter, now[counter] - before[counter], counters[counter] - counters_before[counter], part)
    finally:
        population.terminate()
        population.wait()
    return 1 if verdicts.failed else 0


if __name__ == "__main__":
    sys.exit(main())
