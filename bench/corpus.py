#!/usr/bin/env python3
"""Builds the benchmark corpus: the same bytes on every machine (fixed seed,
fixed dates), kept in a folder of the build tree and made only once."""

import os
import random
import shutil
import subprocess
import sys
import zipfile

SEED = 20261121
# Bump when the corpus changes so that cached copies are rebuilt.
VERSION = "3"
FIXED_TIME = 1_600_000_000  # all files dated alike, so the archives are identical too

SMALL_FILES = 20_000
SMALL_TOP, SMALL_SUB = 97, 13
SMALL_MIN, SMALL_MAX = 512, 16 * 1024
MiB = 1024 * 1024
LARGE_TEXT, LARGE_RANDOM, LARGE_MIXED = 256 * MiB, 128 * MiB, 96 * MiB
LIST_ENTRIES, LIST_FOLDERS = 200_000, 50


def log(message):
    print(f"[corpus] {message}", flush=True)


def text_pool(rng, size):
    """English-like lines over a skewed vocabulary: text that deflate shrinks
    about threefold, like source code or logs."""
    letters = "etaoinshrdlcumwfgypbvkjxqz"
    weights = [26 - i for i in range(26)]
    vocabulary = [
        "".join(rng.choices(letters, weights, k=rng.randint(2, 11))) for _ in range(6000)
    ]
    word_weights = [1.0 / (rank + 1) for rank in range(len(vocabulary))]
    out = bytearray()
    while len(out) < size:
        words = rng.choices(vocabulary, word_weights, k=4096)
        line, lines = [], []
        for word in words:
            line.append(word)
            if len(line) >= rng.randint(6, 14):
                lines.append(" ".join(line))
                line = []
        out += ("\n".join(lines) + "\n").encode()
    return bytes(out[:size])


def slices(rng, pool, size, lo, hi):
    """`size` bytes of text made of pool slices far enough apart that
    deflate's 32 KiB window sees no repeats."""
    out = bytearray()
    while len(out) < size:
        length = rng.randint(lo, hi)
        start = rng.randrange(0, len(pool) - length)
        out += pool[start : start + length]
    return bytes(out[:size])


def write_file(path, data):
    with open(path, "wb") as f:
        f.write(data)
    os.utime(path, (FIXED_TIME, FIXED_TIME))


def date_tree(root):
    for folder, dirs, files in os.walk(root, topdown=False):
        for name in files + dirs:
            os.utime(os.path.join(folder, name), (FIXED_TIME, FIXED_TIME))
    os.utime(root, (FIXED_TIME, FIXED_TIME))


def run(args, cwd, names=None):
    subprocess.run(args, cwd=cwd, check=True, stdout=subprocess.DEVNULL,
                   input="".join(n + "\n" for n in names).encode() if names else None)


def sorted_names(corpus, top):
    """Every folder and file below `top`, sorted: archives list their members
    in this order whatever order the file system returns them in."""
    names = [top]
    for folder, dirs, files in os.walk(os.path.join(corpus, top)):
        relative = os.path.relpath(folder, corpus)
        names += [os.path.join(relative, name) for name in dirs + files]
    return sorted(names)


def archive(corpus, top, zip_name, xar_name):
    names = sorted_names(corpus, top)
    for name in (zip_name, xar_name):
        if os.path.exists(os.path.join(corpus, name)):
            os.remove(os.path.join(corpus, name))  # zip would add to it
    log(f"{top}: zip -6")
    run(["zip", "-6", "-q", "-X", "-@", zip_name], corpus, names)
    log(f"{top}: bsdtar --format xar")
    run(["bsdtar", "--format", "xar", "-n", "-T", "-", "-cf", xar_name], corpus, names)


def make_small(corpus, rng, pool):
    tree = os.path.join(corpus, "small")
    shutil.rmtree(tree, ignore_errors=True)
    folders = [
        os.path.join(tree, f"d{top:02d}", f"s{sub:02d}")
        for top in range(SMALL_TOP)
        for sub in range(SMALL_SUB)
    ]
    for folder in folders:
        os.makedirs(folder)
    for index in range(SMALL_FILES):
        size = rng.randint(SMALL_MIN, SMALL_MAX)
        start = rng.randrange(0, len(pool) - size)
        folder = folders[index % len(folders)]
        write_file(os.path.join(folder, f"f{index:05d}.txt"), pool[start : start + size])
    date_tree(tree)
    archive(corpus, "small", "small.zip", "small.xar")
    shutil.rmtree(tree)


def make_large(corpus, rng, pool):
    tree = os.path.join(corpus, "large")
    shutil.rmtree(tree, ignore_errors=True)
    os.makedirs(tree)
    log("large: text")
    write_file(os.path.join(tree, "text.txt"), slices(rng, pool, LARGE_TEXT, 4096, 65536))
    log("large: random")
    write_file(os.path.join(tree, "random.bin"), rng.randbytes(LARGE_RANDOM))
    log("large: mixed")
    mixed = bytearray()
    while len(mixed) < LARGE_MIXED:
        mixed += slices(rng, pool, 256 * 1024, 4096, 65536)
        mixed += rng.randbytes(256 * 1024)
    write_file(os.path.join(tree, "mixed.bin"), bytes(mixed[:LARGE_MIXED]))
    date_tree(tree)
    archive(corpus, "large", "large.zip", "large.xar")
    # No library writes Deflate64; 7zz is the encoder at hand.
    log("large: 7zz Deflate64")
    if os.path.exists(os.path.join(corpus, "deflate64.zip")):
        os.remove(os.path.join(corpus, "deflate64.zip"))
    run(["7zz", "a", "-tzip", "-mm=Deflate64", "-bd", "-bso0", "deflate64.zip", "large/text.txt"], corpus)
    shutil.rmtree(tree)  # only the archives are needed; keeps 480 MiB off the disk


def make_listing(corpus):
    log("listing: stored zip of empty entries")
    date = (2020, 9, 13, 12, 26, 40)
    with zipfile.ZipFile(os.path.join(corpus, "list.zip"), "w", zipfile.ZIP_STORED) as z:
        for folder in range(LIST_FOLDERS):
            info = zipfile.ZipInfo(f"list/f{folder:02d}/", date)
            info.external_attr = (0o40755 << 16) | 0x10
            z.writestr(info, b"")
            # Folder by folder, as archivers walk a tree.
            for index in range(folder, LIST_ENTRIES, LIST_FOLDERS):
                info = zipfile.ZipInfo(f"list/f{folder:02d}/e{index:06d}.txt", date)
                info.external_attr = 0o100644 << 16
                z.writestr(info, b"")


def main():
    corpus = sys.argv[1]
    stamp = os.path.join(corpus, "stamp")
    if os.path.exists(stamp) and open(stamp).read() == VERSION:
        log(f"using the cached corpus in {corpus}")
        return
    os.makedirs(corpus, exist_ok=True)
    rng = random.Random(SEED)
    log("text pool")
    pool = text_pool(rng, 24 * MiB)
    make_small(corpus, rng, pool)
    make_large(corpus, rng, pool)
    make_listing(corpus)
    with open(stamp, "w") as f:
        f.write(VERSION)
    log("done")


if __name__ == "__main__":
    main()
