#!/usr/bin/env python3
"""Holds tally's figures of puppets against their page frames: the short form of real.py, which `./test` runs.

  puppets.py TALLY FRAMES PUPPET

Exit status 1 when a byte is wrong, 77 where frame numbers are hidden or the kernel cannot scan page tables.
"""
import os, subprocess, sys

import agreement
from measure import Child

SHAPES = ["zoo", "big 40", "memory 600", "family 3 600 same", "family 5 600 random", "family 3 600 half", "family 3 600 drop",
          "family 3 2048 huge", "family 4 600 grow", "family 3 4096 freed", "family 3 600 swapped",
          "family 8 512 reserve8", "family 0 50 reserve40"]


def main():
    tally, frames, puppet = sys.argv[1:]
    can = subprocess.run([frames, str(os.getpid())], stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, text=True)
    if can.returncode == 77:
        print("skipped: " + can.stderr)
        sys.exit(77)
    wrong = []
    for shape in SHAPES:
        with Child([puppet] + shape.split(), "ready") as child:
            lines = [line.split() for line in child.output.splitlines()]
            pids = [child.process.pid] + [int(words[2]) for words in lines if words[0] == "child"]
            comparison, walk = agreement.compare(tally, frames, pids)
            print("%s: %d exact sets, %d of them folded, %d bytes of anonymous memory, %d wrong" %
                  (shape, comparison.sets, comparison.folded, sum(walk.anonymous.values()), len(comparison.differences)))
            wrong += ["%s: %s" % (shape, difference) for difference in comparison.differences]
    sys.exit("\n".join(wrong) or 0)


if __name__ == "__main__":
    main()
