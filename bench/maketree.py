#!/usr/bin/env python3
"""Input trees for bench/compare.

maketree.py tree ROOT FILES DIRS BYTES   FILES files of BYTES bytes spread over
                                         DIRS directories dNNNN/fNNNN
maketree.py flat ROOT ENTRIES            ENTRIES empty files in one directory
"""
import os
import sys


def tree(root, files, dirs, size):
    os.makedirs(root)
    per_dir = -(-files // dirs)
    content = bytes((i * 131 + 7) & 0xFF for i in range(size))
    made = 0
    for d in range(dirs):
        directory = os.path.join(root, "d%04d" % d)
        os.mkdir(directory)
        for f in range(min(per_dir, files - made)):
            with open(os.path.join(directory, "f%04d" % f), "wb") as out:
                out.write(content)
            made += 1


def flat(root, entries):
    os.makedirs(root)
    for i in range(entries):
        os.close(os.open(os.path.join(root, "entry%06d" % i), os.O_WRONLY | os.O_CREAT | os.O_EXCL, 0o644))


if __name__ == "__main__":
    if len(sys.argv) == 6 and sys.argv[1] == "tree":
        tree(sys.argv[2], int(sys.argv[3]), int(sys.argv[4]), int(sys.argv[5]))
    elif len(sys.argv) == 4 and sys.argv[1] == "flat":
        flat(sys.argv[2], int(sys.argv[3]))
    else:
        sys.exit(__doc__)
