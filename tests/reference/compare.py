#!/usr/bin/env python3
"""Reports on random kernels against the reference model.

  compare.py TALLY-SCRIPTED [FIRST [COUNT]]

Runs the tool on the kernels of COUNT (300) seeds from FIRST (0) on. The case of the first one on which they differ stays in the
working folder as reference-SEED.case, and what differs is printed; exit status 1."""
import json, pathlib, subprocess, sys, tempfile

import kernels, model


def differences(expected, found, place="report"):
    if isinstance(expected, dict) and isinstance(found, dict):
        if list(expected) != list(found):
            yield "%s: keys %s, the model has %s" % (place, list(found), list(expected))
        for key in expected:
            yield from differences(expected[key], found.get(key), "%s.%s" % (place, key))
    elif isinstance(expected, list) and isinstance(found, list) and len(expected) == len(found):
        for i, pair in enumerate(zip(expected, found)):
            yield from differences(*pair, "%s[%d]" % (place, i))
    elif expected != found:
        yield "%s: %s, the model says %s" % (place, found, expected)


def told_part(document):
    """Of the tool's document, what the model tells, in its order."""
    kept = ("name", "pid", "tally", "categories", "warnings", "regions")
    processes = [{key: process[key] for key in kept if key in process} for process in document["processes"]]
    return {"processes": processes, "summary": document["summary"], "shared": document["shared"],
            "total tally": document["total tally"]}


def check(program, seed, folder):
    kernel = kernels.Maker(seed).kernel()
    case = pathlib.Path(folder, "reference-%d.case" % seed)
    case.write_text(kernels.case_of(kernel))
    run = subprocess.run([program, case, "0"], cwd=folder, stdout=subprocess.PIPE, stderr=subprocess.PIPE, timeout=60)
    if run.returncode != 0:
        return ["status %d: %s" % (run.returncode, run.stderr.decode(errors="replace"))]
    document = json.loads(pathlib.Path(folder, "report.json").read_bytes())
    return list(differences(model.report(kernel), told_part(document)))


def main(program, first=0, count=300):
    program = pathlib.Path(program).resolve()
    with tempfile.TemporaryDirectory() as folder:
        for seed in range(int(first), int(first) + int(count)):
            found = check(program, seed, folder)
            if found:
                name = "reference-%d.case" % seed
                pathlib.Path(name).write_text(pathlib.Path(folder, name).read_text())
                print("seed %d, %s:" % (seed, name), *found[:20], sep="\n  ")
                return 1
    print("%s reports agree with the model" % count)
    return 0


if __name__ == "__main__":
    sys.exit(main(*sys.argv[1:]))
