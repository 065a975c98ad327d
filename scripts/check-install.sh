#!/usr/bin/env bash
# Checks the library as another project sees it: installs the build tree into
# a temporary prefix, builds examples/ from there through pkg-config and
# through find_package with no path into the source tree, runs them, and
# builds the .deb and checks what it holds. Reuses an existing build tree.
#   scripts/check-install.sh [BUILD_DIR]
set -euo pipefail
cd "$(dirname "$0")/.."
source_dir=$PWD
build_dir=$(realpath "${1:-build}")
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
prefix=$work/prefix

fail() {
  echo "check-install: $*" >&2
  exit 1
}

[[ -f $build_dir/CMakeCache.txt ]] || fail "no configured build tree in $build_dir"
# Packaging builds everything first, one job at a time; do it in parallel here.
cmake --build "$build_dir" --parallel "$(nproc)" >/dev/null
cmake --install "$build_dir" --prefix "$prefix" >/dev/null
libdir=$(dirname "$(find "$prefix" -name GWArchiveSupport.pc)")/..

# The consumer is a copy, so that no include can reach back by relative path.
cp -r examples "$work/examples"
cd "$work/examples"

python3 - <<'PY'
import zipfile
with zipfile.ZipFile("sample.zip", "w", zipfile.ZIP_DEFLATED) as archive:
    archive.writestr("docs/", "")
    archive.writestr("docs/readme.txt", "hello from the archive\n" * 100)
    archive.writestr("empty", "")
PY
expected_listing=$(printf '%12s  %s\n' 0 docs/ 2300 docs/readme.txt 0 empty)

check_examples() {
  local dir=$1
  [[ $("$dir/list_entries" sample.zip) == "$expected_listing" ]] ||
    fail "$dir/list_entries lists: $("$dir/list_entries" sample.zip)"
  cmp -s <("$dir/extract_to_stdout" sample.zip docs/readme.txt) \
    <(python3 -c 'print("hello from the archive\n" * 100, end="")') ||
    fail "$dir/extract_to_stdout does not give the entry's data"
  if "$dir/extract_to_stdout" sample.zip missing 2>/dev/null; then
    fail "$dir/extract_to_stdout succeeds for a missing entry"
  fi
}

# 1. pkg-config, against the shared library.
export PKG_CONFIG_PATH=$libdir/pkgconfig
cflags=$(pkg-config --cflags GWArchiveSupport)
libs=$(pkg-config --libs GWArchiveSupport)
[[ $cflags$libs != *"$source_dir"* ]] || fail "pkg-config names the source tree: $cflags $libs"
mkdir pc
for example in list_entries extract_to_stdout; do
  c++ -std=c++20 $cflags "$example.cpp" -o "pc/$example" $libs -Wl,-rpath,"$libdir"
done
check_examples pc

# Every header the consumer reads comes from the prefix or the system.
c++ -std=c++20 $cflags -E list_entries.cpp -o preprocessed.i
if grep -E '^# [0-9]+ "' preprocessed.i | grep -F -e "$source_dir" -e "$build_dir"; then
  fail "the consumer's preprocessed output names files of the source or build tree"
fi
# Nor does it need the development headers of the libraries behind it.
if grep -E '^# [0-9]+ "' preprocessed.i | grep -E 'sys/acl\.h|pugixml|openssl/|curl/|zlib\.h|bzlib\.h|lzma|zstd|isa-l'; then
  fail "the consumer's preprocessed output needs a dependency's headers"
fi

# 2. find_package, against GWArchiveSupport::GWArchiveSupport.
cmake -S . -B cmake-build -DCMAKE_PREFIX_PATH="$prefix" -DCMAKE_BUILD_TYPE=Release >/dev/null
cmake --build cmake-build --parallel "$(nproc)" >/dev/null
check_examples cmake-build
if grep -rF "$source_dir" cmake-build/CMakeFiles/*.dir/flags.make; then
  fail "find_package brings an include path into the source tree"
fi

# 3. The Debian package.
(cd "$build_dir" && cpack -G DEB -B "$work/deb" >/dev/null)
deb=$(find "$work/deb" -maxdepth 1 -name '*.deb')
[[ -n $deb ]] || fail "cpack made no .deb"
contents=$(dpkg-deb -c "$deb")
for path in ./usr/bin/gwarchive ./usr/lib/libGWArchiveSupport.so.1 ./usr/lib/libGWArchiveSupport.a \
  ./usr/include/GWArchiveSupport/GWArchiveSupport.h ./usr/share/man/man1/gwarchive.1 \
  ./usr/lib/pkgconfig/GWArchiveSupport.pc ./usr/lib/cmake/GWArchiveSupport/GWArchiveSupportConfig.cmake \
  ./usr/share/bash-completion/completions/gwarchive; do
  grep -qE " $path( |$)" <<<"$contents" || fail "$deb lacks $path"
done
depends=$(dpkg-deb -f "$deb" Depends)
for library in libcurl4 libssl3 libpugixml1v5 libacl1 libisal2; do
  [[ $depends == *"$library"* ]] || fail "$deb does not depend on $library: $depends"
done
echo "check-install: consumers built both ways; $(basename "$deb") holds $(wc -l <<<"$contents") paths"
