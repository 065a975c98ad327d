#!/usr/bin/env bash
# What `make run` shows: gwarchive on the two bundled sample archives (made by
# the project's own builders), then the extracted trees with the metadata
# that came back as extended attributes.
set -euo pipefail

build=${1:-build}
tool="$build/gwarchive"
samples="$build/samples"
mkdir -p "$samples"
"$build/gwarchive_samples" "$samples" >/dev/null

out=$(mktemp -d)
trap 'rm -rf "$out"' EXIT

for archive in "$samples/Mac Sample.zip" "$samples/Linked.xar"; do
  echo "\$ gwarchive info '$archive'"
  "$tool" info "$archive"
  echo
  echo "\$ gwarchive list -l '$archive'"
  "$tool" list -l "$archive"
  echo
  echo "\$ gwarchive extract -C OUT '$archive'"
  "$tool" extract --no-progress -C "$out" "$archive"
  echo
done

echo
echo "extracted into OUT:"
(cd "$out" && find . -mindepth 1 | sort | while IFS= read -r item; do
  python3 - "$item" <<'PY'
import os, stat, sys
path = sys.argv[1]
info = os.lstat(path)
kind = "link -> " + os.readlink(path) if stat.S_ISLNK(info.st_mode) else stat.filemode(info.st_mode)
extra = " (%d links)" % info.st_nlink if stat.S_ISREG(info.st_mode) and info.st_nlink > 1 else ""
print("  %-40s %s%s" % (path[2:], kind, extra))
if not stat.S_ISLNK(info.st_mode):
    for name in sorted(os.listxattr(path)):
        value = os.getxattr(path, name)
        text = value.decode("ascii", "replace")
        shown = text if value.isascii() and text.isprintable() else value[:16].hex() + ("..." if len(value) > 16 else "")
        print("      %s = %s" % (name, shown))
PY
done)
