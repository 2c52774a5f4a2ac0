#!/usr/bin/env python3
"""What several processes map and touch at random, against the union of their pages.

  unions.py TALLY PUPPET FOLDER SEED

Each kind of object is mapped in windows that overlap, some twice, some for reading only; pages are read, written and, with
swap in use, swapped out. The summary must hold every page that somebody's page tables show once, in the state that it is in,
and every swapped one of the windows. Prints the kinds that were compared; exit status 1 with what differs, 77 where
the page cache cannot be asked.
"""
import ctypes, json, mmap, os, random, subprocess, sys

PAGE, PAGES, MEMBERS = mmap.PAGESIZE, 512, 5
CATEGORIES = {"file": "mapped file", "memory": "shared memory (memfd)"}
LIBC = ctypes.CDLL(None, use_errno=True)
MEMBER = """
import mmap, os, sys
maps = []
inode = str(os.fstat(int(sys.argv[1])).st_ino)
def starts():
    return {line.split("-")[0] for line in open("/proc/self/maps") if line.split()[4] == inode}
print("ready", flush=True)
for line in sys.stdin:
    word, *numbers = line.split()
    if word == "map":
        file, first, pages, writes = map(int, numbers)
        kind = mmap.PROT_READ | (mmap.PROT_WRITE if writes else 0)
        before = starts()
        maps.append(mmap.mmap(file, pages * mmap.PAGESIZE, mmap.MAP_SHARED, kind, offset=first * mmap.PAGESIZE))
        print((starts() - before).pop(), flush=True)
        continue
    at, page = map(int, numbers)
    if word == "read":
        maps[at][page * mmap.PAGESIZE]
    elif word == "write":
        maps[at][page * mmap.PAGESIZE] = 1
    elif word == "out":
        maps[at].madvise(21, page * mmap.PAGESIZE, 16 * mmap.PAGESIZE)  # MADV_PAGEOUT
    print(word, flush=True)
"""


class Member:
    def __init__(self, file):
        self.process = subprocess.Popen([sys.executable, "-c", MEMBER, str(file)], stdin=subprocess.PIPE, stdout=subprocess.PIPE, text=True,
                                        pass_fds=[file])
        self.pid, self.windows = self.process.pid, []
        assert self.process.stdout.readline() == "ready\n"

    def ask(self, *words):
        print(*words, file=self.process.stdin, flush=True)
        return self.process.stdout.readline().strip()

    def map(self, file, first, pages, writes):
        self.windows.append((int(self.ask("map", file, first, pages, int(writes)), 16), first, pages, writes))

    def present(self):
        """The pages of the object that the page tables show."""
        with open(f"/proc/{self.pid}/pagemap", "rb") as pagemap:
            for start, first, pages, _ in self.windows:
                pagemap.seek(start // PAGE * 8)
                entries = memoryview(pagemap.read(pages * 8)).cast("Q")
                yield from (first + i for i, entry in enumerate(entries) if entry >> 63)

    def end(self):
        self.process.stdin.close()
        self.process.wait()


def summary_of(tally, members, output, kind, *options):
    subprocess.run([*tally, "-j", output, *options] + [word for member in members for word in ("--pid", str(member.pid))], check=True,
                   stdout=subprocess.DEVNULL)
    with open(output) as document:
        sizes = json.load(document)["summary"].get(CATEGORIES[kind], {})
    dirty, swapped, clean = (sizes.get(state, 0) // PAGE for state in ("dirty", "swapped", "clean"))
    return [dirty - swapped, swapped, clean]


def cachestat(file, first, pages):
    """How many pages of a range are in memory, how many of these not on disk yet, and how many swapped out."""
    counts = (ctypes.c_uint64 * 5)()
    if LIBC.syscall(451, file, (ctypes.c_uint64 * 2)(first * PAGE, pages * PAGE), counts, 0) != 0:
        sys.exit(77)
    return counts[0], min(counts[1] + counts[2], counts[0]), counts[3]


def compare(tally, folder, choice, kind, old):
    """@param old the command on a kernel that cannot be asked for the page cache. @return for both views what is expected, and what the summary says more with the object mapped than without; nothing when
    the file was written back meanwhile, or its file system does not tell."""
    name = os.path.join(folder, "object")
    file = os.memfd_create("object") if kind == "memory" else os.open(name, os.O_RDWR | os.O_CREAT | os.O_TRUNC, 0o600)
    for page in range(PAGES):  # one by one, so that each page is written back and swapped out on its own
        os.pwrite(file, b"x" * PAGE, page * PAGE)
    os.fsync(file)
    members = [Member(file) for _ in range(MEMBERS)]
    try:
        views = [[], ["--vmObjectDirty"]]
        before = [summary_of(tally, members, name + ".json", kind, *view) for view in views]
        written = set()
        for member in members:
            for _ in range(choice.choice((1, 1, 2))):
                first = choice.randrange(PAGES - 32)
                member.map(file, first, choice.randrange(32, PAGES - first + 1), choice.random() < 0.7)
            for at, (_, first, pages, writes) in enumerate(member.windows):
                for _ in range(choice.randrange(60)):
                    run = choice.randrange(pages)
                    word = choice.choice(("read", "write", "out" if kind == "memory" else "read"))
                    for page in range(run, min(pages, run + choice.randrange(1, 16))):
                        if word == "write" and writes:
                            member.ask("write", at, page)
                            written.add(first + page)
                        elif word == "out":
                            member.ask("out", at, min(page, pages - 16))
                            break
                        else:
                            member.ask("read", at, page)
        present = {page for member in members for page in member.present()}
        mapped = {page for member in members for _, first, pages, _ in member.windows for page in range(first, first + pages)}
        states = {page: cachestat(file, page, 1) for page in mapped}
        here, _, swapped = ({page for page in mapped if states[page][i]} for i in range(3))
        if kind == "memory":
            expected = [len(present), len(swapped - present), 0], [len(here), len(swapped), 0]
        else:
            expected = [[len(seen & written), 0, len(seen - written)] for seen in (present, here)]
        after = [summary_of(tally, members, name + ".json", kind, *view) for view in views]
        if kind == "file" and cachestat(file, 0, PAGES)[1] != len(written):
            return []
        told = [[now - then for now, then in zip(*pair)] for pair in zip(after, before)]
        outcomes = list(zip(expected, told))
        if kind == "memory":
            sums = [sum(summary_of(old, members, name + ".json", kind, *view)) for view in views]
            told = [([sum(each)], [total]) for each, total in zip(expected, sums)]
            outcomes += told[1:] if expected[0][1] else told  # which pages of a mapping are swapped out is not known then
        return outcomes
    finally:
        for member in members:
            member.end()
        os.close(file)


def main():
    tally, puppet, folder, seed = sys.argv[1:]
    old = [puppet, "refuse", "451", tally]
    choice, compared = random.Random(int(seed)), []
    for kind in ("file", "memory") * 3:
        for expected, told in compare([tally], folder, choice, kind, old):
            if list(expected) != told:
                sys.exit(f"{kind}, seed {seed}: resident dirty, swapped and clean pages are {expected}, the summary says {told}")
            compared.append(f"{kind}: {told}")
    print("\n".join(compared))


main()
