"""What the benchmarks share: programs that are started and ended, and runs that are compared in turn."""
import resource, signal, statistics, subprocess, tempfile, time

RUNS = 5


class Child:
    """A program that says when it is ready; ended when the block is left."""

    def __init__(self, command, ready):
        self.process = subprocess.Popen(command, stdin=subprocess.PIPE, stdout=subprocess.PIPE, text=True)
        self.output = ""
        for line in self.process.stdout:
            self.output += line
            if line.rstrip() == ready:
                return
        raise SystemExit("did not get ready: %s" % command)

    def __enter__(self):
        return self

    def __exit__(self, *_):
        self.process.send_signal(signal.SIGTERM)
        self.process.stdin.close()
        self.process.wait()


def run(command):
    """Wall and processor seconds of one run."""
    before = resource.getrusage(resource.RUSAGE_CHILDREN)
    start = time.monotonic()
    subprocess.run(command, shell=isinstance(command, str), stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    wall = time.monotonic() - start
    after = resource.getrusage(resource.RUSAGE_CHILDREN)
    return wall, after.ru_utime + after.ru_stime - before.ru_utime - before.ru_stime


def peak_of(command):
    """Peak resident MiB of one run. The kernel counts from what a program's parent has, so that is a small one."""
    shell = ["sh", "-c", command] if isinstance(command, str) else command
    with tempfile.NamedTemporaryFile("r") as file:
        subprocess.run(["time", "-f", "%M", "-o", file.name] + shell, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        return int(file.read().split()[-1]) / 1024


def medians_of(commands):
    """Runs the commands in turn, RUNS times after one that does not count: medians of what `run` returns, by name."""
    results = {name: [] for name, _ in commands}
    for turn in range(RUNS + 1):
        for name, command in commands:
            result = run(command)
            if turn > 0:
                results[name].append(result)
    return {name: [statistics.median(column) for column in zip(*rows)] for name, rows in results.items()}
