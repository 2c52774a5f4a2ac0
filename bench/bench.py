#!/usr/bin/env python3
"""Times tally against other ways to read the same memory, side by side in one run, and prints tables.

  bench.py TALLY PROGRAMS [NAME ...]

TALLY is the tool, PROGRAMS the folder of puppet, latency and stop. NAMEs choose among: population libraries big mappings
scaling sparse containers latency stop (all). Commands that are compared run in turn, five times each after one run that does
not count; figures are medians. Everything that is started is ended by pid.
"""
import contextlib, os, platform, resource, shutil, statistics, subprocess, sys, tempfile, time

from measure import Child, medians_of, peak_of

HERE = os.path.dirname(os.path.abspath(__file__))


def run_sampling(command, seconds):
    """Processor seconds of all samples, and how many there were."""
    before = resource.getrusage(resource.RUSAGE_CHILDREN)
    with tempfile.TemporaryFile() as report:
        subprocess.run(["timeout", "-s", "INT", str(seconds)] + command, stdout=report, stderr=subprocess.DEVNULL)
        report.seek(0)
        samples = sum(line.startswith(b"Summary Tally") for line in report)
    after = resource.getrusage(resource.RUSAGE_CHILDREN)
    return after.ru_utime + after.ru_stime - before.ru_utime - before.ru_stime, samples


def compare(title, commands):
    """Runs the commands in turn and prints a table; the last one is what the others are measured by."""
    medians = medians_of(commands)
    base = medians[commands[-1][0]]
    print("\n### %s\n" % title)
    print("| command | wall | of the last | processor time | of the last | peak memory |")
    print("|---|---|---|---|---|---|")
    for name, command in commands:
        wall, spent = medians[name]
        print("| %s | %.1f ms | %.2f | %.1f ms | %.2f | %.1f MiB |" %
              (name, wall * 1e3, wall / base[0], spent * 1e3, spent / base[1] if base[1] else 0, peak_of(command)), flush=True)
    return medians


def others():
    found = []
    if shutil.which("smem"):
        found.append(("smem", ["smem", "-c", "pid pss uss"]))
    if shutil.which("pmap"):
        found.append(("pmap -X of every process", "for p in /proc/[0-9]*; do pmap -X ${p#/proc/}; done"))
    return found


SMAPS_OF_ALL = ("cat of every smaps", "cat /proc/[0-9]*/smaps")


def population(tally, programs):
    with Child([sys.executable, os.path.join(HERE, "population.py"), "--seconds", "560"], "}"):
        medians = compare("The population (370 processes)", [("tally -a", [tally, "-a"])] + others() + [SMAPS_OF_ALL])
        spent, samples = run_sampling([tally, "-a", "--sample", "0.5"], 10)
        print("\nSampled twice a second, a sample takes %.0f ms of processor time, %.2f of one tally -a." %
              (spent / samples * 1e3, spent / samples / medians["tally -a"][1]))


# Modules with libraries of their own: some 150 mappings a process.
INTERPRETER = "import ssl, sqlite3, ctypes, lzma, bz2, decimal, hashlib, asyncio, email, xml.etree.ElementTree, multiprocessing.shared_memory, sys; print('ready', flush=True); sys.stdin.read()"


def libraries(tally, programs):
    with contextlib.ExitStack() as interpreters:
        for _ in range(200):
            interpreters.enter_context(Child([sys.executable, "-c", INTERPRETER], "ready"))
        compare("200 interpreters with many libraries", [("tally -a", [tally, "-a"]), SMAPS_OF_ALL])


def big(tally, programs):
    with Child([programs + "/puppet", "big", "2048"], "ready") as child:
        pid = str(child.process.pid)
        compare("One process of 2 GiB in 4 KiB pages",
                [("tally --pid", [tally, "--pid", pid]), ("cat of smaps", ["cat", "/proc/%s/smaps" % pid])])


MOST_MAPPINGS = "/proc/sys/vm/max_map_count"


def mappings(tally, programs):
    # A process may have 65,530 mappings unless the machine is told otherwise.
    with open(MOST_MAPPINGS) as file:
        before = file.read()
    try:
        with open(MOST_MAPPINGS, "w") as file:
            file.write("200000")
        compare_mappings(tally, programs)
    finally:
        with open(MOST_MAPPINGS, "w") as file:
            file.write(before)


def compare_mappings(tally, programs):
    walls = {}
    for count in (1000, 10000, 50000, 100000):
        with Child([programs + "/puppet", "maps", str(count // 2 * 2)], "ready") as child:
            pid = str(child.process.pid)
            medians = compare("%d mappings" % count, [("tally --pid", [tally, "--pid", pid]),
                                                      ("cat of smaps", ["cat", "/proc/%s/smaps" % pid])])
            walls[count] = medians["tally --pid"][0]
    print("\n100,000 mappings take %.2f times as long as 50,000." % (walls[100000] / walls[50000]))


def scaling(tally, programs):
    for count in (10, 100, 1000):
        sleepers = [subprocess.Popen(["sleep", "300"]) for _ in range(count)]
        try:
            pids = [word for sleeper in sleepers for word in ("--pid", str(sleeper.pid))]
            files = ["/proc/%d/smaps" % sleeper.pid for sleeper in sleepers]
            compare("%d processes" % count, [("tally", [tally] + pids), ("cat of smaps", ["cat"] + files)])
        finally:
            for sleeper in sleepers:
                sleeper.kill()
                sleeper.wait()


def sparse(tally, programs):
    for kids, pages, tebibytes in ((8, 512, 8), (0, 50, 40)):
        shape = [str(kids), str(pages), "reserve%d" % tebibytes]
        with Child([programs + "/puppet", "family"] + shape, "ready") as child:
            lines = [line.split() for line in child.output.splitlines()]
            pids = [str(child.process.pid)] + [words[2] for words in lines if words[0] == "child"]
            compare("%d processes that reserve %d TiB, private and shared, and touched %d pages of each" % (len(pids), tebibytes, pages),
                    [("tally --pid", [tally] + [word for pid in pids for word in ("--pid", pid)]),
                     ("cat of smaps", ["cat"] + ["/proc/%s/smaps" % pid for pid in pids])])


# Programs that wait for their input, or for time to pass.
SMALL = [["sleep", "600"], ["cat"], ["tail", "-f", "/dev/null"], ["sh", "-c", "read line"], ["sort"], ["tr", "a", "b"],
         ["wc"], ["sed", "p"], ["grep", "x"], ["awk", "{}"]]


def containers(tally, programs):
    reader, writer = os.pipe()
    processes = []
    try:
        for command in SMALL * 100:
            processes.append(subprocess.Popen(command, stdin=reader, stdout=subprocess.DEVNULL))
        pids = [str(process.pid) for process in processes]
        compare("1000 processes of 10 different small programs",
                [("tally", [tally] + [word for pid in pids for word in ("--pid", pid)]),
                 ("cat of smaps", ["cat"] + ["/proc/%s/smaps" % pid for pid in pids])])
    finally:
        for process in processes:
            process.kill()
            process.wait()
        os.close(reader)
        os.close(writer)


def latency(tally, programs):
    print("\n### What a process of 2 GiB sees of its own mmap and munmap\n")
    print("| measured by | median | 99th percentile | maximum |\n|---|---|---|---|")
    for name, command in [("nobody", ["-"]), ("tally --pid", [tally, "--pid", "PID"]),
                          ("cat of smaps", ["sh", "-c", 'cat /proc/$0/smaps', "PID"])]:
        rows = [[int(word) for word in subprocess.run([programs + "/latency", "4"] + command, check=True, text=True,
                                                      stdout=subprocess.PIPE).stdout.split()] for _ in range(3)]
        print("| %s | %d us | %d us | %d us |" % ((name,) + tuple(statistics.median(column) for column in zip(*rows))),
              flush=True)


def stop(tally, programs):
    # What else runs on the machine shall not displace the spinning thread.
    undisplaced = ["chrt", "-f", "10"] if os.geteuid() == 0 and shutil.which("chrt") else []
    print("\n### The longest gap that a spinning thread sees while its process is measured once\n")
    print("| process | measured by | median | maximum | times |\n|---|---|---|---|---|")
    for name, mebibytes, threads in [("2 threads, little memory", "0", "1"), ("200 threads, little memory", "0", "199"),
                                     ("2 threads, 64 MiB", "64", "1"), ("2 threads, 2 GiB", "2048", "1")]:
        for measured_by, command in [("nobody", ["-"]), ("tally --pid", [tally, "--pid", "PID"]),
                                     ("tally --forkCorpse --pid", [tally, "--forkCorpse", "--pid", "PID"])]:
            output = subprocess.run(undisplaced + [programs + "/stop", "5", mebibytes, threads] + command, check=True,
                                    text=True, stdout=subprocess.PIPE).stdout.split()
            print("| %s | %s | %.1f ms | %.1f ms | %s |" %
                  (name, measured_by, int(output[0]) / 1e3, int(output[1]) / 1e3, output[2]), flush=True)


def main():
    tally, programs = sys.argv[1:3]
    print("Linux %s, %d processors, %s" % (platform.release(), os.cpu_count(), time.strftime("%Y-%m-%d")))
    measurements = {each.__name__: each for each in
                    (population, libraries, big, mappings, scaling, sparse, containers, latency, stop)}
    for name in sys.argv[3:] or measurements:
        measurements[name](os.path.abspath(tally), os.path.abspath(programs))


if __name__ == "__main__":
    main()
