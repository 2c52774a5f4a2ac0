"""Holds tally's figures of processes that hold still against a walk of their page frames (frames.cpp), to the byte.

What is compared, of the document that `tally -v -j` writes:

- anonymous bytes (dirty and lazily freed together) and swapped anonymous bytes by exact set of holders. An object that each
  of its holders has in full is such a set. One that they have different parts of is what tally folded: there the walk's sets
  less what tally shows as exact must add up to it, by first holder and, for each process, by what it holds.
- lazily freed bytes by process, since of a family's pages tally knows them by mapping only. None may be shown where there
  is less than the kernel's counters can tell.
- shared memory by process and in all, each page once; the sum not where copies of it have the same name. Tally knows its
  sharers by object, not by page.
"""
import collections, json, os, subprocess, tempfile

Figures = collections.namedtuple("Figures", "anonymous swapped freed held shmem")
ATTEMPTS = 5
UNTOLD_BY_COUNTERS = (64 << 10) * os.cpu_count()  # of lazily freed memory


def walked(frames, pids):
    """What the walk finds: bytes by tuple of pids, by pid, and in all."""
    output = subprocess.run([frames] + [str(pid) for pid in pids], check=True, text=True, stdout=subprocess.PIPE).stdout
    found = collections.defaultdict(collections.Counter)
    for line in output.splitlines():
        kind, count, holders = line.split()
        found[kind][tuple(sorted(int(pid) for pid in holders.split(",")))] += int(count)
    freed = {pid: found["freed"][pid,] for pid in pids}
    held = {pid: sum(size for holders, size in found["shmem"].items() if pid in holders) for pid in pids}
    return Figures(found["anonymous"], found["swapped"], freed, held, sum(found["shmem"].values()))


def devices_of_shared_memory():
    """The devices of every tmpfs, as the kernel writes them in maps."""
    memory = os.memfd_create("any")
    device = os.fstat(memory).st_dev
    os.close(memory)
    devices = {(os.major(device), os.minor(device))}
    with open("/proc/self/mountinfo") as file:
        for line in file:
            if line.split(" - ")[1].startswith(("tmpfs ", "devtmpfs ")):
                devices.add(tuple(int(word) for word in line.split()[2].split(":")))
    return devices


class Mappings:
    """What smaps says of addresses that are asked for in rising order."""

    def __init__(self, pid, devices):
        self.at, self.ranges = 0, []
        with open("/proc/%d/smaps" % pid, errors="replace") as file:
            for words in (line.split(None, 5) for line in file):
                if not words[0].endswith(":"):
                    start, end = (int(word, 16) for word in words[0].split("-"))
                    is_memory = words[4] != "0" and tuple(int(word, 16) for word in words[3].split(":")) in devices
                    is_private = words[1][3] == "p"
                    kind = ("copied" if is_private else "shmem") if is_memory else "anonymous" if is_private else "file"
                    figures = {}
                    self.ranges.append((start, end, kind, figures))
                elif words[0] in ("Rss:", "Anonymous:"):
                    figures[words[0]] = int(words[1])

    def kind(self, region):
        """Of a private mapping of shared memory the first piece is what it has not copied, if there is such memory."""
        while self.ranges[self.at][1] <= region["addr"]:
            self.at += 1
        start, _, kind, figures = self.ranges[self.at]
        if kind == "copied":
            has_memory = figures["Rss:"] > figures["Anonymous:"]
            kind = "shmem" if has_memory and region["addr"] == start else "anonymous"
        return kind


def reported(document, pids):
    """What tally says: bytes by object and pid for `anonymous` and `swapped`, by pid, and in all."""
    devices = devices_of_shared_memory()
    anonymous, swapped = (collections.defaultdict(collections.Counter) for _ in range(2))
    freed, held, shared, copied = {}, {}, set(), set()
    for process in document["processes"]:
        pid = process["pid"]
        freed[pid] = held[pid] = 0
        if process.get("errors") or "regions" not in process:
            raise SystemExit("tally could not measure %d: %s" % (pid, process.get("errors")))
        mappings = Mappings(pid, devices)
        for region in process["regions"]:
            if "addr" not in region or region["name"] == "page table":
                continue
            kind = mappings.kind(region)
            if kind == "anonymous":
                anonymous[region["id"]][pid] += region.get("dirty", 0) + region.get("reclaimable", 0)
                swapped[region["id"]][pid] += region.get("swapped", 0)
                freed[pid] += region.get("reclaimable", 0)
                copied.add(region["name"])
            elif kind == "shmem":
                held[pid] += region.get("dirty", 0)
                shared.add(region["name"])
    rows = {name: row["dirty"] - row["swapped"] for name, row in document["summary"].items()}
    # Copies in a private mapping of shared memory are in the row of its name.
    shmem = None if shared & copied else sum(rows[name] for name in shared)
    missing = set(pids) - set(freed)
    if missing:
        raise SystemExit("tally says nothing of %s" % sorted(missing))
    return Figures(anonymous, swapped, freed, held, shmem)


class Comparison:
    """Differences in words, and how many exact sets there were."""

    def __init__(self):
        self.differences, self.sets, self.folded = [], 0, 0

    def equal(self, what, measured, expected):
        if measured != expected:
            self.differences.append("%s: tally says %d, its frames are %d bytes" % (what, measured, expected))

    def sets_of(self, kind, objects, walk):
        exact, folded = collections.Counter(), collections.defaultdict(collections.Counter)
        for holders in objects.values():
            holders = {pid: size for pid, size in holders.items() if size}
            if len(set(holders.values())) == 1:
                exact[tuple(sorted(holders))] += next(iter(holders.values()))
            elif holders:
                first = min(holders)
                folded[first].update(holders)
        remainders = collections.defaultdict(collections.Counter)
        for holders in sorted(set(exact) | set(walk)):
            rest = walk[holders] - exact[holders]
            first = holders[0]
            if rest < 0 or (rest > 0 and first not in folded):
                self.equal("%s, exactly %s" % (kind, ",".join(map(str, holders))), exact[holders], walk[holders])
            elif rest:
                remainders[first].update({pid: rest for pid in holders})
        for first, members in folded.items():
            for pid in sorted(set(members) | set(remainders[first])):
                self.equal("%s, folded to %d, part of %d" % (kind, first, pid), members[pid], remainders[first][pid])
        self.sets += len(walk)
        self.folded += len(walk) - len([holders for holders in walk if walk[holders] == exact[holders]])

    def freed(self, tally, walk):
        if sum(walk.values()) <= UNTOLD_BY_COUNTERS and not any(tally.values()):
            return
        for pid in sorted(walk):
            self.equal("lazily freed by %d" % pid, tally[pid], walk[pid])


def measured(tally, pids):
    """The document that tally writes of the processes."""
    with tempfile.NamedTemporaryFile(dir="/dev/shm") as file:
        command = [tally, "-v", "-j", file.name] + [word for pid in pids for word in ("--pid", str(pid))]
        subprocess.run(command, check=True, stdout=subprocess.DEVNULL)
        return json.load(file)


def compare(tally, frames, pids):
    """Compares the two, while the machine lets the pages be (it swaps, and makes huge pages). @return it and the walk"""
    walk = walked(frames, pids)
    for _ in range(ATTEMPTS):
        said, before, walk = reported(measured(tally, pids), pids), walk, walked(frames, pids)
        if before == walk:
            break
    else:
        raise SystemExit("the pages of %s do not hold still" % pids)
    comparison = Comparison()
    comparison.sets_of("anonymous", said.anonymous, walk.anonymous)
    comparison.sets_of("swapped", said.swapped, walk.swapped)
    comparison.freed(said.freed, walk.freed)
    for pid in pids:
        comparison.equal("shared memory held by %d" % pid, said.held[pid], walk.held[pid])
    if said.shmem is not None:
        comparison.equal("shared memory in all", said.shmem, walk.shmem)
    return comparison, walk


if __name__ == "__main__":
    import sys
    result, found = compare(sys.argv[1], sys.argv[2], [int(pid) for pid in sys.argv[3:]])
    print("%d sets, %d of them folded, %d bytes of anonymous memory" % (result.sets, result.folded, sum(found.anonymous.values())))
    sys.exit("\n".join(result.differences) or 0)
