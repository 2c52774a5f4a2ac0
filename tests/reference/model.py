"""What a report on a kernel has to say, computed the slow way: page by page, byte by byte and object by object.

A kernel is what kernels.py makes. Sizes are bytes, ids and addresses numbers, "sizes" lists of [dirty, swapped, clean,
reclaimable, wired]."""
import dataclasses, itertools

PRESENT, DIRTY, PAGED_OUT, EXTERNAL, REUSABLE = 0x1, 0x8, 0x10, 0x80, 0x800  # of a page
COW, PRIVATE, EMPTY, SHARED, PRIVATE_ALIASED = 1, 2, 3, 4, 6  # share modes
VOLATILE, EMPTIED, NOT_PURGEABLE = 1, 2, 3
UNMAPPED_TAG, NOT_SET = 0xFFFFFFFF, 2**64 - 1
UNMAPPED_NAME = "Owned physical tally (unmapped)"
TAG_NAMES = {
    0: 'untagged ("VM_ALLOCATE")', 1: "malloc metadata", 2: "MALLOC_SMALL", 3: "MALLOC_LARGE", 4: "MALLOC_HUGE",
    5: "sbrk", 6: "realloc", 7: "MALLOC_TINY", 8: "MALLOC_LARGE_REUSABLE", 9: "MALLOC_LARGE_REUSED",
    10: "performance tool data", 11: "MALLOC_NANO", 18: "system/kernel diagnostics", 20: "Mach message",
    21: "driver framework", 30: "stack", 31: "guard", 32: "shared pmap", 33: "dylib", 34: "Objective-C dispatching code",
    35: "unshared pmap", 40: "desktop toolkit", 41: "desktop toolkit data", 42: "graphics drawing",
    43: "networking framework", 44: "Java", 45: "object persistence", 46: "object persistence cache", 50: "fonts",
    51: "animation", 52: "graphics", 53: "graphics server", 54: "graphics devices", 55: "graphics acceleration",
    56: "graphics mapping", 57: "graphics effects", 58: "web engine", 60: "dyld private memory",
    61: "dyld malloc memory", 62: "SQLite page cache", 63: "WebAssembly", 64: "JS JIT generated code",
    65: "JS VM register file", 66: "OpenGL Shading Language", 67: "OpenCL", 68: "image scaling", 69: "image decoding",
    70: "font rendering", 71: "media", 72: "media playback", 73: "user-interface assets", 74: "networking",
    75: "system logging", 76: "thumbnails", 77: "accounts", 78: "web engine scripts", 79: "web engine objects",
    80: "corpse info", 81: "system log data", 82: "Swift runtime", 83: "Swift metadata", 84: "graphics data",
    86: "graphics scenes", 87: "graphics surfaces", 88: "media captions", 89: "media codecs", 90: "audio",
    91: "video bitstream", 92: "media decoding", 93: "media processing", 94: "media capture", 95: "image analysis",
    96: "networking buffers", 97: "user-interface framework", 98: "font cache",
    UNMAPPED_TAG: UNMAPPED_NAME}
LEDGER_NAMES = {2: " (network)", 3: " (media)", 4: " (graphics)", 5: " (neural)"}
RESERVED = {(0xFC0000000, 0x40000000): "commpage (reserved)", (0x1000000000, 0x6000000000): "GPU Carveout (reserved)"}
CACHE_ALIGNMENT = 4096


@dataclasses.dataclass(eq=False)
class Region:
    name: str
    start: int
    size: int
    id: int
    share: int
    tag: int = 0
    offset: int = 0
    detail: str = ""
    segment: str = "not set"
    sizes: list = dataclasses.field(default_factory=lambda: [0] * 5)
    wired: bool = False
    cached: bool = False  # a piece of the shared cache
    gap: bool = False
    owned: bool = False
    ranges: object = None

    def charged(self):
        return self.sizes[0] + self.sizes[1]

    def all_sizes(self):
        return self.sizes[:4] + [self.size if self.wired else 0]

    def full_name(self):
        return self.name + (" " + self.detail if self.detail else "")

    def is_shared(self):
        return self.tag != UNMAPPED_TAG and not self.cached and self.share not in (PRIVATE, EMPTY, PRIVATE_ALIASED) and \
            self.segment not in ("text", "data", "linkedit")


def round_down(value, unit):
    return value // unit * unit


def round_up(value, unit):
    return -(-value // unit) * unit


# Mappings and their pages.

def leaves(mapping):
    return itertools.chain.from_iterable(map(leaves, mapping.nested)) if mapping.nested else [mapping]


def words_of(kernel, mapping):
    """The state of its pages; those past the end are absent."""
    return mapping.object_words if not kernel.charged and mapping.object_words else mapping.words


def word_at(kernel, task, address):
    for mapping in itertools.chain.from_iterable(map(leaves, task.mappings)):
        if mapping.start <= address < mapping.start + mapping.size:
            words, index = words_of(kernel, mapping), (address - mapping.start) // kernel.page
            return words[index] if index < len(words) else 0
    return 0


def shared_cache(task):
    return task.cache if task.cache and not task.cache.private else None


def walked_mappings(task):
    """Every mapping, or the cache's as one: (mapping, whether it is the cache's as one)."""
    cache = shared_cache(task)
    # What lies below the cache is searched for to 16 MiB; without anything there the cache is walked like the rest.
    is_passed = cache and any(16 << 20 < m.start + m.size <= cache.base for m in task.mappings)
    seen_unmapped = False
    for top in task.mappings:
        if is_passed and top.start < cache.base + cache.size and top.start + top.size > cache.base:
            yield top, True
            continue
        for mapping in leaves(top):
            if seen_unmapped and mapping.tag != UNMAPPED_TAG:
                return
            seen_unmapped = mapping.tag == UNMAPPED_TAG
            yield mapping, False


# Images.

def segment_kind(name):
    if name.startswith(("__TEXT", "__OBJC_RO")):
        return "text"
    return "linkedit" if name == "__LINKEDIT" else "data" if name.startswith("__") else "not set"


def segments_of(task):
    """(start, end, name, path, kind) by start."""
    cache = shared_cache(task)
    found, linkedits = [], set()
    for image in task.images:
        in_cache = cache and cache.base <= image.base < cache.base + cache.size
        for name, start, size in image.segments:
            shown = "__TEXT" if name == "MACH_HEADER" else name.split(" ")[0] or "unknown"
            kind, path = segment_kind(shown), image.path if in_cache else task.links.get(image.path, image.path)
            if in_cache and kind == "linkedit":
                if start in linkedits:
                    continue
                linkedits.add(start)
                path = "dyld shared cache"
            found.append((start, start + size, shown, path, kind))
    return sorted(found, key=lambda segment: segment[0])


def segment_in(segments, start, end):
    for segment in segments:
        if segment[1] > start and segment[0] != segment[1]:
            return segment if segment[0] <= start or segment[0] < end else None
    return None


# Regions.

def cache_pieces(kernel, task, segments, mapping, as_one):
    """The mapping cut along the images' segments; a page in which pieces meet is told to the byte."""
    end = mapping.start + mapping.size
    at, previous, pieces = mapping.start, None, []
    while at < end:
        segment = segment_in(segments, at, end)
        gap = not segment or at < segment[0]
        piece = Region("unused dyld shared cache area", at, 0, 1 if as_one else kernel.id(mapping), COW if as_one else mapping.share,
                       0 if as_one else mapping.tag, mapping.offset + at - mapping.start, cached=True, gap=gap, wired=mapping.wired)
        if gap:
            stop = segment[0] if segment else end
            before = previous[4] if previous else None
            after = segment[4] if segment else "not set"
            after_is_data = segment and after not in ("text", "linkedit")
            piece.segment = after if before is None or (before in ("text", "linkedit") and after_is_data) else before
        else:
            stop = min(segment[1], end)
            follower = segment_in(segments, stop, end)
            if follower != segment and at % CACHE_ALIGNMENT == 0 and (not follower or follower[0] % CACHE_ALIGNMENT == 0):
                stop = round_up(stop, CACHE_ALIGNMENT)  # with its padding
            piece.name, piece.detail, piece.segment, previous = segment[2], segment[3], segment[4], segment
        piece.size, at = stop - at, stop
        pieces.append(piece)
    # The bytes of each: all of a data segment's, and of a gap those in a page that data before or right behind it was asked for.
    asked = None  # the page in which data ended last
    for i, piece in enumerate(pieces):
        end = piece.start + piece.size
        first, last = round_down(piece.start, kernel.page), round_down(end - 1, kernel.page)
        if piece.segment in ("text", "linkedit"):
            continue
        follower = pieces[i + 1] if i + 1 < len(pieces) else None
        data_follows = follower and not follower.gap and follower.segment not in ("text", "linkedit")
        for page in range(first, last + 1, kernel.page):
            bytes_here = min(page + kernel.page, end) - max(page, piece.start)
            known = not piece.gap or (page == first and page == asked) or (page == last and end % kernel.page != 0 and data_follows)
            word = word_at(kernel, task, page) if known else 0
            if word & DIRTY or word & (PRESENT | EXTERNAL) == PRESENT:
                piece.sizes[0] += bytes_here
            elif word & PAGED_OUT:
                piece.sizes[1] += bytes_here
        if not piece.gap and end % kernel.page != 0:
            asked = last
    return pieces


def counts_of(kernel, mapping):
    words = words_of(kernel, mapping)
    if mapping.counts and words is mapping.words:
        return mapping.counts
    return [sum(1 for w in words if is_counted(w)) for is_counted in (lambda w: w & PRESENT, lambda w: w & DIRTY, lambda w:
            w & PRESENT and w & REUSABLE, lambda w: w & PAGED_OUT)]


def counted_sizes(kernel, mapping, purge):
    resident, written, reusable, swapped = counts_of(kernel, mapping)
    if purge == EMPTIED:
        return [0, 0, 0, mapping.size, 0]
    if purge == VOLATILE:
        return [0, 0, 0, resident * kernel.page, 0]
    kept = max(resident - reusable, 0)
    dirty = written if mapping.external or kernel.charged else kept
    return [dirty * kernel.page, swapped * kernel.page, max(kept - dirty, 0) * kernel.page, reusable * kernel.page, 0]


def runs_of_pages(kernel, mapping, region, purge):
    """The ranges of one state, by their place in the object; None without any."""
    def kind(word):
        return 1 if word & PAGED_OUT else 0 if word & DIRTY else \
            3 if word & (PRESENT if purge == VOLATILE else REUSABLE) else 2 if word & PRESENT else None
    ranges, at = Ranges(), region.offset
    for state, run in itertools.groupby(map(kind, words_of(kernel, mapping))):
        length = len(list(run)) * kernel.page
        if state is not None:
            sizes = [0, 0, 0, 0, length if region.wired else 0]
            sizes[state] = length
            ranges.add(at, length, kernel.page, sizes)
        at += length
    return ranges if ranges.nodes else None


def charge_owned(region, owned):
    region.owned = True
    region.sizes = [0, 0, 0, owned.reusable, 0]
    if not owned.no_tally and owned.purgeable in (VOLATILE, EMPTIED):
        region.sizes[0] = owned.wired
    elif not owned.no_tally:
        region.sizes[:2] = [max(owned.resident - owned.reusable, 0), owned.swapped]


def tag_name(tag):
    return TAG_NAMES.get(tag) or ("app-specific tag %d" % (tag - 239) if 240 <= tag < 256 else "tag %d" % tag)


def with_ledger(name, tag):
    return name + (" (VM ledger tag %d)" % tag if tag > 5 else LEDGER_NAMES.get(tag, ""))


def regions_of(kernel, task, hidden, warn):
    segments = [] if hidden else segments_of(task)
    owned = dict(task.owned) if task.owned is not None and kernel.charged and not hidden else None
    cache = shared_cache(task)
    regions, kernels_figure, behind_mappings = [], None, 0
    for mapping, as_one in walked_mappings(task):
        if cache and mapping.start + mapping.size > cache.base and mapping.start < cache.base + cache.size:
            regions += [] if hidden else cache_pieces(kernel, task, segments, mapping, as_one)
            continue
        purge = NOT_PURGEABLE if mapping.purge_fails else mapping.purgeable
        is_figure = mapping.tag == UNMAPPED_TAG and purge not in (VOLATILE, EMPTIED)
        if is_figure and owned is not None:
            continue
        region = Region("", mapping.start, mapping.size, kernel.id(mapping), mapping.share, mapping.tag, mapping.offset,
                        segment="none", wired=mapping.wired, sizes=counted_sizes(kernel, mapping, purge))
        segment = segment_in(segments, mapping.start, mapping.start + mapping.size)
        if segment:
            region.name, region.detail, region.segment = segment[2:]
        elif mapping.external:
            region.name, region.detail = "mapped file", mapping.file
        elif (mapping.start, mapping.size) in RESERVED:
            region.name = RESERVED[mapping.start, mapping.size]
        else:
            region.name = tag_name(mapping.tag)
            if kernel.charged and owned is not None and kernel.id(mapping) in owned:
                record = owned.pop(kernel.id(mapping))
                charge_owned(region, record)
                region.name = with_ledger(region.name, record.tag)
                behind_mappings += region.charged()
            elif kernel.charged and owned is None and purge != NOT_PURGEABLE and mapping.tag != 87 and \
                    counts_of(kernel, mapping)[0]:
                region.owned = True
                region.sizes = [region.sizes[0] + region.sizes[2], 0, 0, region.sizes[3], 0]
                behind_mappings += region.charged()
        is_mixed = region.size not in region.sizes[:4] and any(region.sizes)
        if kernel.charged and not hidden and region.is_shared() and not region.owned and region.size > kernel.page and is_mixed:
            region.ranges = runs_of_pages(kernel, mapping, region, purge)
        if is_figure:
            kernels_figure = region
        else:
            regions.append(region)
    for id, record in sorted((owned or {}).items()):
        region = Region(with_ledger(UNMAPPED_NAME, record.tag), NOT_SET, record.virtual, id, SHARED, UNMAPPED_TAG,
                        wired=record.wired != 0)
        charge_owned(region, record)
        regions.append(region)
    if kernels_figure:  # covers what was found behind mappings as well
        rest = behind_mappings
        for i in (0, 1):
            taken = min(rest, kernels_figure.sizes[i])
            kernels_figure.sizes[i] -= taken
            rest -= taken
        if rest:
            warn("%s [%d]: Tally changed while analyzing – unmapped owned physical tally may be over-counted by %d bytes" %
                 (task.name, task.pid, rest))
        if kernels_figure.charged():
            kernels_figure.start = NOT_SET
            regions.append(kernels_figure)
    if kernel.charged and not hidden and task.page_table > 0:
        regions.append(Region("page table", NOT_SET, task.page_table, NOT_SET, PRIVATE, sizes=[task.page_table, 0, 0, 0, 0]))
    return regions


# Objects.

class Ranges:
    """Ranges of an object that do not meet. Two that meet or share a page become one, which holds what both do but counts
    nothing twice where they overlap."""

    def __init__(self):
        self.nodes = []  # [start, end, sizes]

    def add(self, start, size, page, sizes):
        first, last, new = round_down(start, page), round_up(start + size, page), [start, start + size, sizes]
        apart = []
        for node in self.nodes:
            if round_up(node[1], page) < first or round_down(node[0], page) > last:
                apart.append(node)
                continue
            overlap = max(min(round_up(node[1], page), last) - max(round_down(node[0], page), first), 0)
            new = [min(node[0], new[0]), max(node[1], new[1]), [max(a, b, a + b - overlap) for a, b in zip(node[2], new[2])]]
        self.nodes = sorted(apart + [new], key=lambda node: node[0])

    def add_region(self, region, page):
        if region.ranges:
            for start, end, sizes in region.ranges.nodes:
                self.add(start, end - start, page, sizes)
            region.ranges = None
        else:
            self.add(region.offset, region.size, page, region.all_sizes())

    def sum(self):
        return [sum(node[2][i] for node in self.nodes) for i in range(5)]


class Object:
    def __init__(self):
        self.regions, self.by_pid, self.ranges, self.owner = [], {}, Ranges(), None

    def add(self, kernel, region, pid=None):
        self.regions.append(region)
        if region.id == 0:
            return
        if pid is not None and (self.by_pid or region.is_shared()):
            self.by_pid.setdefault(pid, []).append(region)
        self.ranges.add_region(region, kernel.page)

    def finish(self, sums, charged):
        self.totals = self.ranges.sum()
        if sums:
            self.totals[:2] = [sum(r.sizes[i] for r in self.regions) for i in (0, 1)]
        elif charged:
            for own in self.by_pid.values():
                self.totals[:2] = [max(self.totals[i], sum(r.sizes[i] for r in own)) for i in (0, 1)]
        if len(self.by_pid) < 2 or all(len(own) == 1 and own[0].all_sizes() == self.totals for own in self.by_pid.values()):
            self.by_pid = {}
        named = self.representative()
        if named.tag != UNMAPPED_TAG:  # what its owner does not map is called as others call it
            for region in self.regions:
                if region.tag == UNMAPPED_TAG:
                    region.name, region.detail = named.name, named.detail

    def representative(self):
        wanted = lambda region: True
        if self.regions[0].cached:
            wanted = lambda region: not region.gap
        elif self.owner is not None:
            wanted = lambda region: region.tag != UNMAPPED_TAG
        return next(filter(wanted, self.regions), self.regions[0])

    def key(self, kernel):
        return self.representative().full_name() if kernel.verbose else self.representative().name

    def view(self, kernel, pid):
        """(totals, regions, whether it is not simply the object's)"""
        totals, count, own = self.totals, len(self.regions), pid in self.by_pid
        if own:
            seen = Object()
            seen.owner = self.owner
            for region in self.by_pid[pid]:
                seen.add(kernel, region)
            seen.finish(kernel.charged, kernel.charged)
            totals, count = seen.totals, len(seen.regions)
        if self.owner not in (None, pid):  # who pays for it
            totals, own = [0, 0, totals[2] + sum(self.totals[:2]), 0, totals[4]], True
        return totals, count, own


def object_of(kernel, task, region, tables):
    table, key = "ordinary", region.id
    if region.cached:
        cache = shared_cache(task)
        table, key = ("cache", cache.uuid), region.start - cache.base + 1
        if region.segment not in ("text", "linkedit") and region.charged():
            key ^= task.pid << 32
    elif region.segment in ("text", "linkedit"):
        table = region.segment
    if key in (0, NOT_SET):
        return Object()
    return tables.setdefault((table, key), Object())


# The report.

def row(totals, regions):
    return dict(zip(("dirty", "swapped", "clean", "reclaimable", "wired", "regions"), [sum(totals[:2])] + totals[1:] + [regions]))


def rows(entries):
    """Of (key, totals, regions)."""
    sums = {}
    for key, totals, regions in entries:
        had = sums.get(key, ([0] * 5, 0))
        sums[key] = ([a + b for a, b in zip(had[0], totals)], had[1] + regions)
    return {key: row(*sums[key]) for key in sorted(sums, key=str.encode)}


def region_entry(region):
    told = {"offset": region.offset, "dirty": region.sizes[0], "swapped": region.sizes[1], "clean": region.sizes[2],
            "reclaimable": region.sizes[3], "wired": region.size if region.wired else 0}
    return {"id": region.id, "name": region.full_name(), "addr": region.start, "vsize": region.size} | \
        {key: value for key, value in told.items() if value} if region.start != NOT_SET else \
        {"id": region.id, "name": region.full_name(), "vsize": region.size} | {key: value for key, value in told.items() if value}


def report(kernel):
    tables, objects, warnings = {}, [], {}
    tasks = sorted((t for t in kernel.tasks if kernel.searches or t.pid in kernel.targets), key=lambda task: task.pid)
    shown = [task for task in tasks if task.pid in kernel.targets]
    regions, object_at = {}, {}
    for task in tasks:
        warnings[task.pid] = []
        regions[task.pid] = regions_of(kernel, task, task not in shown, warnings[task.pid].append)
        for region in regions[task.pid]:
            found = object_of(kernel, task, region, tables)
            found.add(kernel, region, task.pid)
            if kernel.charged and region.owned:
                found.owner = task.pid
            object_at[region] = found
            if found not in objects:
                objects.append(found)
    for each in objects:
        each.finish(False, kernel.charged)
    members = {}  # by object, in the order in which they are met
    for task in tasks:
        for each in map(object_at.get, regions[task.pid]):
            is_searched_for = each.owner in kernel.targets and any(r.tag == UNMAPPED_TAG for r in each.regions)
            if task in shown or is_searched_for:
                members.setdefault(each, {})[task.pid] = None
    groups = {}  # objects by who maps them
    for each, pids in members.items():
        groups.setdefault(tuple(pids), []).append(each)

    def distinct(task):
        return list(dict.fromkeys(object_at[region] for region in regions[task.pid]))

    tally = {task.pid: sum(r.charged() for r in regions[task.pid]) if kernel.charged else
             sum(sum(each.totals[:2]) for each in distinct(task)) for task in shown}
    document, shared, told = {"processes": []}, [], set()
    for task in sorted(shown, key=lambda task: (tally[task.pid], task.pid), reverse=True):
        entry = {"name": task.name, "pid": task.pid, "tally": tally[task.pid]}
        own_groups = [pids for pids in groups if task.pid in pids]
        if not own_groups or (task.pid,) in own_groups:
            entry["categories"] = {}
        if warnings[task.pid]:
            entry["warnings"] = warnings[task.pid]
        if kernel.verbose:
            entry["regions"] = [region_entry(region) for region in regions[task.pid]]
        for pids in own_groups:
            views = [(each.key(kernel), *each.view(kernel, task.pid)) for each in groups[pids]]
            table = rows(view[:3] for view in views)
            is_own_view = any(view[3] for view in views)
            if len(pids) == 1:
                entry["categories"] = table
            elif is_own_view:
                shared.append({"pids": list(pids), "specific_to_pid": task.pid, "categories": table})
            elif pids not in told:
                told.add(pids)
                shared.append({"pids": list(pids), "categories": table})
        document["processes"].append(entry)
    counted = list(dict.fromkeys(itertools.chain.from_iterable(map(distinct, shown))))
    document["summary"] = rows((each.key(kernel), each.totals, len(each.regions)) for each in counted)
    document["shared"] = shared
    totals = [sum(each.totals[i] for each in counted) for i in range(5)]
    document["summary"]["total"] = row(totals, sum(len(each.regions) for each in counted))
    document["total tally"] = sum(totals[:2])
    return document
