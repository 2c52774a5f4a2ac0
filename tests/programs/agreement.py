#!/usr/bin/env python3
"""Whether the three outputs of one run of `tally -f bytes -w -v -j x.json --benchlog x.blj` say the same.

  agreement.py FOLDER

FOLDER holds them: out, x.json, x.blj. Every figure of the text is compared with the document's, and every metric with that.
Prints how many reports there are; exit status 1 with what differs.
"""
import collections, json, re, sys

MOST_NAMED = 20  # a larger set of sharers is a number in the text
KINDS = ("dirty", "swapped", "clean", "reclaimable", "wired", "regions")
BYTES = r"\s*(\d+) B" * 5
ROW = re.compile(BYTES + r"\s+(\d+)\s+(.*)")
REGION = re.compile(r"\s+(\S+) - \s*(\S+)\s+\[ *([0-9a-f]+)\]" + r"\s+(\d+)" * 6 + r"\s+(.*)")


def facts_of_text(lines):
    """What a report says: (place, name, figures)."""
    facts, pid, where, path = collections.Counter(), None, None, []
    for line in lines:
        if match := ROW.match(line):
            if match[7] != "TOTAL" or where == "summary":  # no other sum is in the document
                facts[where, match[7], tuple(map(int, match.groups()[:6]))] += 1
        elif match := REGION.match(line):
            facts[pid, "region", match[1], match[2], match[3], match[10], tuple(map(int, match.groups()[3:9]))] += 1
        elif match := re.fullmatch(r"(.*\[(\d+)\]: (?:64|32)-bit)?(?:.*\tTally: (\d+) B \(\d+ bytes per page\))?", line):
            if match[1]:
                pid = int(match[2])
                where = pid, "own"
            if match[3]:  # below warnings
                facts[pid, "total", int(match[3])] += 1
        elif line.startswith("Shared with "):
            many = re.fullmatch(r"Shared with (\d+) processes:", line)
            pids = [pid] + [int(each) for each in re.findall(r"\[(\d+)\](?=,|:$)", line)]
            where = pid, "shared", int(many[1]) if many else tuple(sorted(pids))
        elif match := re.match(r"Summary Tally: (\d+) B", line):
            where = pid = "summary"
            facts[pid, "total", int(match[1])] += 1
        elif match := re.fullmatch(r"(\t+)(.*?):(?: (-?\d+) B)?", line):
            path[len(match[1]) - 1:] = [match[2]]
            if match[3]:
                facts[pid, "auxiliary", *path, int(match[3])] += 1
        elif match := re.fullmatch(r".* \[(\d+)\]", line):
            pid = int(match[1])  # of a listing
    return facts


def auxiliary_of(value, path=()):
    for key, entry in (value or {}).items():
        yield from auxiliary_of(entry, path + (key,)) if isinstance(entry, dict) else [path + (key, entry)]


def shared_of(report, pid):
    """The records of "shared" that `pid` sees: its own view, or the common one."""
    return [each for each in report["shared"] if pid in each["pids"] and each.get("specific_to_pid", pid) == pid]


def facts_of_document(report):
    facts = collections.Counter()

    def add_categories(where, categories):
        for name, sizes in categories.items():
            row = "TOTAL" if where == "summary" and name == "total" else name
            facts[where, row, tuple(sizes[kind] for kind in KINDS)] += 1

    for process in report["processes"]:
        pid, page = process["pid"], process["page size"]
        if "tally" in process:
            facts[pid, "total", process["tally"]] += 1
        for region in process["regions"]:
            size = collections.defaultdict(int, region)
            bounds = ("%x" % size["addr"], "%x" % (size["addr"] + size["vsize"])) if "addr" in region else ("unmapped",) * 2
            sizes = (size["vsize"], size["dirty"] + size["swapped"], size["swapped"], size["clean"], size["reclaimable"],
                     size["wired"])
            facts[pid, "region", *bounds, "%x" % (size["id"] & 0xffffffffff), region["name"],
                  tuple(-(-bytes // page) for bytes in sizes)] += 1
        add_categories((pid, "own"), process.get("categories", {}))
        for record in shared_of(report, pid):
            pids = record["pids"]
            add_categories((pid, "shared", len(pids) if len(pids) > MOST_NAMED else tuple(pids)), record["categories"])
        for entry in auxiliary_of(process["auxiliary"]):
            facts[pid, "auxiliary", *entry] += 1
    if len(report["processes"]) != 1:
        facts["summary", "total", report["total tally"]] += 1
        add_categories("summary", report["summary"])
        for entry in auxiliary_of(report["auxiliary"]):
            facts["summary", "auxiliary", *entry] += 1
    return facts


def metrics_of(report):
    """What the performance data must say: (metric, process) and its value, group by group."""
    groups = []

    def add(name, categories):
        for category, sizes in categories.items():
            if category != "total":
                groups[-1][category, name] += sizes["dirty"]

    def add_auxiliary(name, auxiliary):
        for *path, value in auxiliary_of(auxiliary):
            groups[-1][".".join(["aux_data"] + path), name] = value

    for process in report["processes"]:
        name = process["name"]
        groups.append(collections.defaultdict(int))
        if "tally" in process:
            groups[-1]["total_memory", name] = process["tally"]
            for record in shared_of(report, process["pid"]):
                add(name, record["categories"])
        add(name, process.get("categories", {}))
        add_auxiliary(name, process["auxiliary"])
    groups.append(collections.defaultdict(int, {("total_memory", "ALL_PROCESSES"): report["total tally"]}))
    add("ALL_PROCESSES", report["summary"])
    add_auxiliary("ALL_PROCESSES", report["auxiliary"])
    end, start = (report[key]["mach_continuous_time_ns"] for key in ("end_time", "start_time"))
    groups[-1]["gather_duration", ""] = (end - start) // 1000000
    return groups


def metrics_in(lines):
    groups = []
    for entry in map(json.loads, lines):
        if "metric" not in entry:
            groups.append({})
        else:
            groups[-1][entry["metric"], entry.get("variables", {}).get("process", "")] = entry["value"]
        if entry["group"] != len(groups):
            sys.exit("group %s is the %d." % (entry["group"], len(groups)))
    return groups


def main(folder):
    with open(folder + "/x.json", encoding="utf-8") as file:
        document = json.load(file)
    with open(folder + "/out", encoding="utf-8", errors="surrogateescape") as file:
        lines = file.read().split("\n")
    with open(folder + "/x.blj", encoding="utf-8") as file:
        header, *metrics = file.read().splitlines()
    reports = document.get("samples", [document])
    starts = [number for number, line in enumerate(lines) if line.startswith("Time: ")] if "samples" in document else [0]
    dates = [report["start_time"]["date"].replace("T", " ") for report in reports]
    if "samples" in document and [lines[start][6:6 + len(date)] for start, date in zip(starts, dates)] != dates:
        sys.exit("the text's samples began at %s, the document's at %s" % ([lines[start] for start in starts], dates))
    if len(starts) != len(reports):
        sys.exit("%d reports in the text, %d in the document" % (len(starts), len(reports)))
    for start, end, report in zip(starts, starts[1:] + [len(lines)], reports):
        text, expected = facts_of_text(lines[start:end]), facts_of_document(report)
        if text != expected:
            sys.exit("only in the text: %s\nonly in the document: %s" % (list(text - expected)[:3], list(expected - text)[:3]))
    expected = [dict(group) for report in reports for group in metrics_of(report)]
    if json.loads(header)["benchlog"] != 1 or metrics_in(metrics) != expected:
        sys.exit("the performance data differ from the document")
    print(len(reports))


if __name__ == "__main__":
    main(sys.argv[1])
