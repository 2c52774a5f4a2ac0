"""Random kernels in which what is rare on a real machine is common, and their text as a case file."""
import dataclasses, itertools, random

from model import DIRTY, EXTERNAL, PAGED_OUT, PRESENT, REUSABLE, UNMAPPED_TAG, round_up

CACHE_BASES = [0x180000000, 0x180000000, 0x1A0000000]
RESERVED = [(0xFC0000000, 0x40000000), (0x1000000000, 0x6000000000), (0x1000000000, 0x5000000000)]
SEGMENTS = ["__TEXT", "__TEXT_EXEC", "__DATA", "__DATA x", "__OBJC_RO", "__LINKEDIT", "__LINKEDIT_2", "MACH_HEADER", "", "other"]


@dataclasses.dataclass
class Mapping:
    start: int
    size: int
    words: list = dataclasses.field(default_factory=list)  # what is charged; a disposition a page, 0 past the end
    object_words: list = dataclasses.field(default_factory=list)  # what the object holds; empty: the same
    counts: tuple = None  # resident, dirty, reusable and swapped pages where the mapping's counts say otherwise than `words`
    tag: int = 0
    object: int = 0
    offset: int = 0
    share: int = 2
    file: str = ""
    external: bool = False
    purgeable: int = 3
    purge_fails: bool = False
    wired: bool = False
    nested: list = dataclasses.field(default_factory=list)


@dataclasses.dataclass
class Owned:
    virtual: int
    resident: int
    wired: int
    reusable: int
    swapped: int
    no_tally: bool
    tag: int
    purgeable: int


@dataclasses.dataclass
class Cache:
    uuid: int
    base: int
    size: int
    private: bool


@dataclasses.dataclass
class Image:
    path: str
    base: int
    segments: list  # (name, start, size)


@dataclasses.dataclass
class Task:
    pid: int
    name: str
    page_table: int
    owned: dict  # by id; None: no list
    cache: Cache
    images: list
    links: dict  # of paths
    mappings: list


@dataclasses.dataclass
class Kernel:
    page: int
    short_ids: bool
    charged: bool  # the view
    verbose: bool
    searches: bool  # all processes, for what the targets own
    targets: list
    tasks: list

    def id(self, mapping):
        return mapping.object & 0xFFFFFFFF if self.short_ids else mapping.object


class Maker:
    def __init__(self, seed):
        self.random = random.Random(seed)
        self.page = self.random.choice([4096, 4096, 16384])
        self.objects = [5, 6, 0x700000008, 9, 0x300000005, 88]

    def one(self, *choices):
        return self.random.choice(choices)

    def chance(self, percent):
        return self.random.randrange(100) < percent

    def words(self, pages, external):
        """Dispositions, in runs."""
        of_file = EXTERNAL if external else 0
        result = []
        while len(result) < pages:
            word = self.one(0, 0, PRESENT | of_file, PRESENT | of_file, PRESENT | DIRTY | of_file, PRESENT, PAGED_OUT,
                            PRESENT | REUSABLE | of_file, PRESENT | DIRTY | REUSABLE, DIRTY | PAGED_OUT)
            result += [word] * self.random.randrange(1, 4)
        return result[:pages]

    def contents(self, mapping):
        pages = min(mapping.size // self.page, 12)
        mapping.words = self.words(pages, mapping.external)
        if self.chance(30):
            mapping.object_words = self.words(pages, mapping.external)
        return mapping

    def mapping(self, start):
        mapping = Mapping(start, self.random.randrange(1, 9) * self.page, external=self.chance(30))
        mapping.tag = self.one(0, 30, 87, 90, 300, self.random.randrange(256))
        mapping.object = self.one(*self.objects, *self.objects, 0, self.random.randrange(100, 1 << 40))
        mapping.offset = self.random.randrange(0, 4) * self.page
        mapping.share = self.one(1, 2, 3, 4, 4, 4, 5, 6, 7, 8)
        mapping.file = self.one("", "/a", "/b\n\xe9") if mapping.external else ""
        mapping.purgeable = self.one(3, 3, 3, 0, 1, 2)
        mapping.purge_fails = self.chance(5)
        mapping.wired = self.chance(10)
        self.contents(mapping)
        if self.chance(4):  # more than one query asks for, with gaps
            mapping.size = self.random.randrange(8100, 9000) * self.page
            mapping.words += [0] * self.random.randrange(3000, 8000) + mapping.words
        if self.chance(8):  # as when pages come and go between two counters
            mapping.counts = tuple(self.random.randrange(6) for _ in range(4))
        uniform = self.random.randrange(10)  # mappings that are wholly of one kind, or untouched
        if uniform < 3 and mapping.size < 100 * self.page:
            mapping.words = [(PRESENT | DIRTY, PRESENT | EXTERNAL, 0)[uniform]] * (mapping.size // self.page)
        return mapping

    def mappings(self, start):
        at, result = start, []
        for _ in range(self.random.randrange(1, 7)):
            at += self.one(0, 0, 1, 5) * self.page
            if self.chance(10):
                inner = [self.mapping(at)]
                inner.append(self.mapping(at + inner[0].size + self.one(0, 1) * self.page))
                result.append(Mapping(at, inner[1].start + inner[1].size - at, nested=inner, object=1))
            else:
                result.append(self.mapping(at))
            at = result[-1].start + result[-1].size
        return result

    def segments(self, base, size):
        """Of one image, from `base` on: some touch, leave gaps inside pages or whole ones, some overlap or are empty."""
        at, result = base, []
        while at < base + size:
            length = self.one(0, 1, 0x40, 0x800, 0x1000, 0x2800, 0x3000, self.page, 2 * self.page)
            result.append((self.one(*SEGMENTS), at, length))
            at += length + self.one(0, 0, 0x40, 0x800, 0x1000, self.page)
            at = self.one(at, at, round_up(at, 0x1000), max(at - 0x20, base) if length > 0x20 else at)
        return result

    def with_cache(self, task):
        uuid = self.one(1, 1, 2)
        size, base = self.cache_sizes[uuid], self.one(*CACHE_BASES)
        task.cache = Cache(uuid, base, size, self.chance(10))
        ids = dict(object=self.one(70, 70, 71), offset=0x5000, share=self.one(1, 4), external=True, wired=self.chance(20))
        if self.chance(50):
            middle = self.random.randrange(1, size // self.page) * self.page
            whole = Mapping(base, size, **ids)
            whole.nested = [self.contents(Mapping(base, middle, tag=33, **ids)),
                            self.contents(Mapping(base + middle, size - middle, tag=33, **ids))]
        else:
            whole = self.contents(Mapping(base, size, **ids))
        segments = [(name, base + start, length) for name, start, length in self.cache_segments if start < size]
        half = len(segments) // 2
        task.images += [Image("/lib one", base, segments[:half]), Image("/lib two", base + 1, segments[half:])]
        return [whole]

    def task(self, pid):
        task = Task(pid, self.one("p", "q") + str(pid), self.one(0, 0x3000, -5), None, None, [], {}, [])
        task.links = self.one({}, {"/bin/p": "/bin/real", "/lib one": "/never asked"})
        task.mappings = self.mappings(self.one(0x10000, 0x40000000))
        if self.chance(30):  # what an image covers
            first = task.mappings[0]
            task.images.append(Image("/bin/p", first.start, self.segments(first.start, first.size)))
        if self.chance(50):
            task.mappings += self.with_cache(task)
        if self.chance(40):
            task.mappings += self.mappings(0x1B0000000)
        if self.chance(20):
            task.mappings += [Mapping(*self.one(*RESERVED), object=3)]
        if self.chance(60):
            size = lambda: self.random.randrange(0, 9) * 0x1000
            task.owned = {self.one(*self.objects, 300): Owned(size(), size(), self.one(0, size()), self.one(0, size()), size(),
                                                              self.chance(15), self.random.randrange(8), self.one(0, 1, 2, 3))
                          for _ in range(self.random.randrange(4))}
        if self.chance(40):  # the kernel's own figure, at the end
            figure = self.contents(Mapping(0x8000000000, 9 * self.page, tag=UNMAPPED_TAG, object=self.one(0, 88)))
            figure.purgeable, figure.share = self.one(3, 3, 1), self.one(2, 4)
            task.mappings += [figure]
            if self.chance(50):
                task.mappings += self.mappings(0x8000000000 + 20 * self.page)
        return task

    def kernel(self):
        self.cache_sizes = {uuid: self.random.randrange(2, 12) * self.page for uuid in (1, 2)}
        self.cache_segments = self.segments(self.one(0, 0x800, self.page), 10 * self.page)
        tasks = [self.task(100 + i) for i in range(self.random.randrange(1, 5))]
        charged = self.chance(70)
        targets = [task.pid for task in tasks if task.pid == 100 or self.chance(60)]
        return Kernel(self.page, self.chance(20), charged, self.chance(70), charged and self.chance(40), targets, tasks)


def escaped(text):
    return "".join(r"\x%02x" % byte if byte <= 32 or byte in b"\\=" or byte > 126 else chr(byte) for byte in text.encode())


def statement(keyword, **values):
    """A line of a case file; True is a plain word, what is absent or empty is left out."""
    parts = [" %s" % key.replace("_", "-") if value is True else " %s=%s" % (key.replace("_", "-"), value)
             for key, value in values.items() if value is not None and value is not False and value != ""]
    return keyword + "".join(parts)


def mapping_lines(mapping):
    words = lambda list: ",".join("%d*%d" % (word, len([*run])) for word, run in itertools.groupby(list))
    yield statement("map", start=hex(mapping.start), size=mapping.size, submap=len(mapping.nested) or None, tag=mapping.tag,
                    object=mapping.object, offset=mapping.offset, share=mapping.share, file=escaped(mapping.file),
                    external=int(mapping.external), purgeable=mapping.purgeable, purgeable_fails=5 if mapping.purge_fails else None,
                    wired=mapping.wired, counts=mapping.counts and ",".join(map(str, mapping.counts)), pages_words=words(mapping.words), object_pages_words=words(mapping.object_words))
    for inner in mapping.nested:
        yield from mapping_lines(inner)


def case_of(kernel):
    lines = [statement("kernel", page_size=kernel.page, short_ids=kernel.short_ids)]
    for task in kernel.tasks:
        lines.append(statement("task %d %s page_table=%d" % (task.pid, task.name, max(task.page_table, 0)),
                               no_owned_list=task.owned is None))
        if task.cache:
            lines.append(statement("cache", uuid=task.cache.uuid, base=task.cache.base, size=task.cache.size, private=task.cache.private))
        lines += ["link %s %s" % (escaped(link), escaped(target)) for link, target in task.links.items()]
        for image in task.images:
            segments = " ".join("%s@%d+%d" % (escaped(name), start, size) for name, start, size in image.segments)
            lines.append("image %s base=%d %s" % (escaped(image.path), image.base, segments))
        for mapping in task.mappings:
            lines += mapping_lines(mapping)
        for id, owned in (task.owned or {}).items():
            lines.append(statement("owned", id=id, **vars(owned)))
    options = [] if kernel.charged else ["--vmObjectDirty"]
    options += ["-v"] if kernel.verbose else []
    options += ["--unmapped"] if kernel.searches else []
    return "\n".join(lines + ["run %s -j report.json %s" % (" ".join(options), " ".join(map(str, kernel.targets)))]) + "\n"
