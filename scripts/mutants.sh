#!/usr/bin/env bash
# Mutation check of the test suite: a fixed list of small faults put into the
# library and the tool one at a time; each must make the suite fail.
#
# Usage: scripts/mutants.sh [options]
#   -t, --tree DIR      tree to mutate (default: the working tree this script is in;
#                       uncommitted changes count, untracked files under .gitignore do not)
#   -o, --only IDS      run only these mutants: comma-separated ids or ranges (M03,M10-M14)
#   -s, --scratch DIR   scratch copy and build (default: /tmp/gwarchive-mutants); reused
#                       between runs, so a second run only rebuilds what changed
#   -T, --time-limit S  per-mutant limit on each test run in seconds (default: twice the
#                       unmutated suite's time plus two minutes); a hang is killed by it
#   -j, --jobs N        build jobs (default 2)
#       --no-hints      run only the whole suite, not each mutant's likely tests first
#       --no-baseline   skip building and testing the unmutated tree (reruns only)
#   -c, --check         only check that every original text occurs once in the tree
#   -l, --list          print the mutants and exit
#
# For each mutant the scratch copy gets the one change, is rebuilt (Release, ccache;
# only the library, gwarchive and gwarchive_tests), and gwarchive_tests runs with
# --gtest_fail_fast in two shards in parallel, each with its own TMPDIR; the first
# shard to fail stops the other. The mutant's hint filter runs first, then, if that
# passed, the rest of the suite. The file is restored afterwards.
#
# Time, on 2 cores shared with other work: the unmutated suite about 3 minutes; a
# mutant its hint tests kill 10 to 20 seconds (one file recompiled, a relink with lld,
# a few suites); one that survives the whole suite again (about 3 minutes); one that
# hangs the time limit. All 68 took about 45 minutes. The first run builds the scratch
# tree (about 10 minutes with a warm ccache, much longer without).
#
# Output: one line per mutant (id, place, verdict, first failing test, seconds), then
# totals; logs in SCRATCH/logs. A kill whose test passes when rerun alone is checked by
# repeating the run, so a flaky test does not count as catching the fault.
# Exit status: 0, or 1 if a mutant did not apply or build, 2 if the unmutated tree
# does not pass, 64 on a usage error.
set -uo pipefail

# id @@ file @@ original text (unique in the file; \n is a newline) @@ replacement
#    @@ tests tried first (gtest filter) @@ what the fault is
read -r -d '' MUTANTS <<'EOF'
M01 @@ foundation/GWByteReader.cpp @@ if (failed_ || count > remaining()) { @@ if (failed_ || count > remaining() + 1) { @@ GWByteReader.*:Mutations/GWZipArchiveHostile.* @@ skip() may step one byte past the end
M02 @@ foundation/GWByteReader.cpp @@ if (failed_ || offset > bytes_.size() || length > bytes_.size() - offset) { @@ if (failed_ || offset > bytes_.size()) { @@ GWByteReader.* @@ slice() no longer checks its length
M03 @@ foundation/GWContainment.cpp @@ name != "." && name != ".." && @@ name != "." && @@ GWContainment.*:*Containment* @@ ".." counts as a plain path component
M04 @@ foundation/GWContainment.cpp @@ if (path.size() <= prefix || path.compare(0, base.size(), base) != 0 ||\n        path[prefix - 1] != '/') { @@ if (path.size() <= prefix || path.compare(0, base.size(), base) != 0) { @@ GWContainment.*:*Containment* @@ a sibling whose name starts with the root's counts as inside it
M05 @@ foundation/GWContainment.cpp @@ if (!S_ISDIR(info.st_mode)) { @@ if (!S_ISDIR(info.st_mode) && !S_ISLNK(info.st_mode)) { @@ GWContainment.*:*Containment* @@ a symbolic link on the way down counts as a directory
M06 @@ foundation/GWDate.cpp @@ constexpr double kSecondsFrom1601To1970 = 11644473600.0; @@ constexpr double kSecondsFrom1601To1970 = 11644387200.0; @@ GWDate.*:*ExtraField* @@ NTFS epoch one day off
M07 @@ foundation/GWDate.cpp @@ return era * 146097 + doe - 719468; @@ return era * 146097 + doe - 719469; @@ GWDate.*:GWZipArchiveOpen.*:GWXARTOC* @@ civil dates one day off
M08 @@ foundation/GWChecksum.cpp @@ return GWData{std::uint8_t(value), std::uint8_t(value >> 8), @@ return GWData{std::uint8_t(value >> 8), std::uint8_t(value), @@ GWChecksum.* @@ CRC-32 digest bytes in the wrong order
M09 @@ foundation/GWStreamPipeline.cpp @@ return computed && expected && *computed == *expected; @@ return computed && expected; @@ EveryCheck/*:*Integrity*:GWXARArchiveHostileChecksum.* @@ stream digest comparison dropped
M10 @@ foundation/GWFileSystem.cpp @@ int result = ::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE); @@ int result = ::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), 0); @@ GWFileSystem.*:Cases/GWFileSystemMove.* @@ moving without replacing replaces
M11 @@ foundation/GWFileSystem.cpp @@ constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC; @@ constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_CLOEXEC; @@ GWFileSystem.*:*Containment* @@ directory walk follows symbolic links
M12 @@ foundation/GWFileSystem.cpp @@ if (name == "." || name == "..") { @@ if (name == ".") { @@ GWFileSystem.*:*Containment* @@ directory walk accepts ".."
M13 @@ foundation/GWFileSystem.cpp @@ GWReplacementFolder::~GWReplacementFolder() {\n    GWRemoveItemRecursively(path_, nullptr); @@ GWReplacementFolder::~GWReplacementFolder() { @@ GWFileSystem.*:GWZipExtractOperationTest.* @@ replacement folder left behind
M14 @@ foundation/GWDispatch.cpp @@ if (--count_ != 0) { @@ if (--count_ > 1) { @@ GWGroup.*:GWDispatchQueue.* @@ a group notifies while one member is still inside
M15 @@ foundation/GWHTTPPrefetcher.cpp @@ lock.unlock();\n        if (!reader) { @@ if (!reader) { @@ GWRemoteFileHandleHTTPTest.*:GWZipArchiveRemote.* @@ prefetch worker keeps its lock while fetching
M16 @@ foundation/GWBlockCache.cpp @@ while (blocks_.size() > blockCount_) { @@ while (blocks_.size() > blockCount_ + 1) { @@ GWBlockCacheTest.* @@ block cache holds one block over its limit
M17 @@ foundation/GWExtractPolicy.cpp @@ const std::uint32_t kept = options.keepSetIDBits ? 07777 : 0777; @@ const std::uint32_t kept = options.keepSetIDBits ? 07777 : 07777; @@ *Grants*:*Containment* @@ set-ID bits kept without being asked
M18 @@ foundation/GWExtractPolicy.cpp @@ if (linuxName.starts_with("user.") || options.privilegedAttributes) { @@ if (linuxName.starts_with("") || options.privilegedAttributes) { @@ *Grants*:GWMetadataStoreTest.* @@ privileged extended attributes written without being asked
M19 @@ foundation/decoders/GWDeflate64Decoder.cpp @@ 4097, 6145, 8193, @@ 4097, 6144, 8193, @@ GWInflateReference.*:GWDecompressor.*:EveryDecoder/* @@ deflate distance table entry off by one
M20 @@ foundation/decoders/GWDeflate64Decoder.cpp @@ constexpr std::uint8_t kCodeLengthOrder[19] = {16, 17, 18, 0, 8,  7, 9,  6, 10, 5, @@ constexpr std::uint8_t kCodeLengthOrder[19] = {16, 17, 18, 0, 8,  9, 7,  6, 10, 5, @@ GWInflateReference.*:GWDecompressor.*:EveryDecoder/* @@ code-length order of dynamic blocks swapped
M21 @@ foundation/decoders/GWExplodeDecoder.cpp @@ token.distance = ((high << lowDistanceBits_) | low) + 1; @@ token.distance = ((high << lowDistanceBits_) | low); @@ GWExplodeDecoder.*:GWLegacyDecoders.*:EveryDecoder/* @@ implode distances one short
M22 @@ foundation/decoders/GWUnshrinkDecoder.cpp @@ constexpr unsigned kFirstTableCode = 257; @@ constexpr unsigned kFirstTableCode = 258; @@ GWUnshrinkDecoder.*:GWLegacyDecoders.*:EveryDecoder/* @@ shrink table starts one code late
M23 @@ zip/GWZipCentralDirectory.cpp @@ if (!reader.ok() || parsed.signature != GWZipCentralDirectoryRecord::kSignature) { @@ if (!reader.ok()) { @@ Mutations/GWZipArchiveHostile.*:GWZipArchiveOpen.* @@ central record signature not checked
M24 @@ zip/GWZipCentralDirectory.cpp @@ if (record.uncompressedSize == kGWZip32BitSentinel) { @@ if (record.uncompressedSize != kGWZip32BitSentinel) { @@ GWZipExtractLarge.*:GWZipArchiveOpen.* @@ Zip64 compressed size read from the wrong slot
M25 @@ zip/GWZipCentralDirectory.cpp @@ GWDate::gregorianDateWithYear((date >> 9) + 1980, @@ GWDate::gregorianDateWithYear((date >> 9) + 1970, @@ GWZipArchiveOpen.*:GWZipFile* @@ DOS date epoch 1970 instead of 1980
M26 @@ zip/GWZipCentralDirectory.cpp @@ time >> 11, (time >> 5) & 0x3F, time & 0x1F); @@ time >> 11, (time >> 5) & 0x3F, (time & 0x1F) * 2); @@ GWZipArchiveOpen.*:GWZipFile* @@ DOS seconds doubled
M27 @@ zip/GWZipCentralDirectory.cpp @@ constexpr std::uint16_t kUTF8NamesFlag = 0x0800; @@ constexpr std::uint16_t kUTF8NamesFlag = 0x0400; @@ GWZipArchiveOpen.*:GWZipArchiveLookup.* @@ UTF-8 name flag bit wrong
M28 @@ zip/GWZipEndRecord.cpp @@ if (end.centralDirectoryOffset == kGWZip32BitSentinel) { @@ if (end.centralDirectoryOffset > kGWZip32BitSentinel) { @@ GWZipExtractLarge.*:GWZipArchiveOpen.* @@ Zip64 end record not looked for behind an escaped offset
M29 @@ zip/GWZipEndRecord.cpp @@ } else if (end.totalEntries == 0xFFFF || end.entriesOnDisk == 0xFFFF || @@ } else if (end.totalEntries == 0xFFFE || end.entriesOnDisk == 0xFFFE || @@ GWZipExtractLarge.*:GWZipArchiveOpen.* @@ Zip64 record ignored when only the entry count is escaped
M30 @@ zip/GWZipExtraFieldsCommon.cpp @@ } else if (field.size() > 15) { @@ } else if (field.size() > 16) { @@ *ExtraField*:GWZipLocalHeader.* @@ local Zip64 field of exactly two sizes ignored
M31 @@ zip/GWZipExtraFieldsUnix.cpp @@ if (*flags & (1u << bit)) { @@ if (*flags & (2u << bit)) { @@ *ExtraField*:GWZipLocalHeader.* @@ extended timestamp flag bits shifted
M32 @@ zip/GWZipWorkOperation.cpp @@ case 0x5455: @@ case 0x5456: @@ *ExtraField* @@ extended timestamp field ID wrong
M33 @@ zip/GWZipExtraFieldsMac.cpp @@ info.insert_or_assign(kGWZipIsResourceForkKey, GWValue((*forkFlags & 0x01) == 0)); @@ info.insert_or_assign(kGWZipIsResourceForkKey, GWValue((*forkFlags & 0x01) != 0)); @@ GWZipMacExtraFields.*:*ExtraField* @@ Mac field's fork flag inverted
M34 @@ zip/GWZipExtractDestination.cpp @@ contained = !ancestor->isSymbolicLink(); @@ contained = true; @@ GWZipContainment.*:Hostile/GWZipContainment.* @@ entries below a symbolic-link entry are written through it
M35 @@ zip/GWZipWorkOperation.cpp @@ if (header.signature != GWZipLocalFileHeader::kSignature) { @@ if (header.signature == 0) { @@ GWZipLocalHeader.*:Mutations/GWZipArchiveHostile.* @@ local header signature not checked
M36 @@ zip/GWZipDecryption.cpp @@ ? std::uint8_t(header.modificationTime >> 8) @@ ? std::uint8_t(header.crc32 >> 24) @@ PeerArchives/GWZipExtractEncrypted.*:GWZipArchiveExtraction.* @@ ZipCrypto check byte of streamed entries taken from the CRC
M37 @@ zip/GWZipDecryption.cpp @@ codeLength < kMACLength || CRYPTO_memcmp(code.data(), tail_.data(), kMACLength) != 0) { @@ codeLength < kMACLength) { @@ PeerArchives/GWZipExtractEncrypted.*:EveryCheck/* @@ AES authentication code not compared
M38 @@ zip/GWZipExtractStream.cpp @@ version->second.unsignedValue() == 2; @@ version->second.unsignedValue() == 1; @@ PeerArchives/GWZipExtractEncrypted.*:EveryCheck/* @@ CRC skipped for AE-1 instead of AE-2
M39 @@ zip/GWZipExtractStream.cpp @@ if (check.decodedDigest && *check.decodedDigest != GWData(4, 0)) { @@ if (false) { @@ EveryCheck/*:GWZipArchiveExtraction.* @@ empty entry's CRC not checked
M40 @@ xar/GWXARLoadOperationHeader.cpp @@ if (magic != "xar!") { @@ if (magic.empty()) { @@ GWXARArchiveOpen.*:Headers/GWXARArchiveHostile.* @@ XAR magic not checked
M41 @@ xar/GWXARLoadOperationHeader.cpp @@ if (inflated->size() != decompressedLength) { @@ if (inflated->size() > decompressedLength) { @@ GWXARArchiveOpen.*:*/GWXARArchiveHostile.* @@ short table of contents accepted
M42 @@ xar/GWXARLoadOperationTOC.cpp @@ if (storedAlgorithm != algorithm || *stored != tocChecksum()) { @@ if (storedAlgorithm != algorithm) { @@ GWXARArchiveHostileChecksum.*:*/GWXARArchiveHostile.* @@ table-of-contents digest comparison dropped
M43 @@ xar/GWXARHeapStream.cpp @@ !(outcome.storedDigestMatches(check) && outcome.decodedDigestMatches(check)); @@ !outcome.decodedDigestMatches(check); @@ GWXARArchiveHostileChecksum.*:*DataStream*:XarExtraction* @@ archived-checksum of heap data not compared
M44 @@ xar/GWXARTOCEntryParser.cpp @@ {"block special", 0060000}, {"directory", 0040000}, {"symlink", 0120000}, @@ {"block special", 0060000}, {"directory", 0040000}, {"symlnk", 0120000}, @@ GWXARTOCEntries.*:GWXARFileType.* @@ TOC type name "symlink" misspelt
M45 @@ xar/GWXARTOCEntryParser.cpp @@ } else if (name == "uid") { @@ } else if (name == "user-id") { @@ GWXARTOCEntries.*:GWXARFile* @@ TOC element "uid" not read
M46 @@ xar/GWXARExtractDestinations.cpp @@ if (!GWIsPlainPathComponent(name)) { @@ if (name.empty()) { @@ Hostile/GWXARContainment.*:*Containment* @@ XAR names not checked for "..", "/"
M47 @@ xar/GWXARTOCEntryParser.cpp @@ if (std::string_view(link.value()) != "original") { @@ if (std::string_view(link.value()) != "origin") { @@ GWXARArchiveLinks.*:GWXARTOCEntries.* @@ hard link attribute "original" misspelt
M48 @@ xar/GWXARDigestSignature.cpp @@ return {result == 1 ? GWXARSignatureCheck::valid : GWXARSignatureCheck::invalid, 0}; @@ return {result >= 0 ? GWXARSignatureCheck::valid : GWXARSignatureCheck::invalid, 0}; @@ GWXARSignature*:Signatures/* @@ a failed signature verification counts as valid
M49 @@ xar/GWXARTrust.cpp @@ if (verified == 1) {\n        ERR_clear_error(); @@ if (verified >= 0) {\n        ERR_clear_error(); @@ GWXARSignature*:GWXARTrustedRootScope.*:Signatures/* @@ an untrusted chain counts as trusted
M50 @@ applefile/GWMacBinaryHeader.cpp @@ crc = std::uint16_t((crc & 0x8000) ? (crc << 1) ^ 0x1021 : crc << 1); @@ crc = std::uint16_t((crc & 0x8000) ? (crc << 1) ^ 0x1023 : crc << 1); @@ GWMacBinaryTest.*:Headers/GWMacBinaryMalformedTest.* @@ MacBinary CRC polynomial wrong
M51 @@ applefile/GWMacBinaryDecoder.cpp @@ return 128 - length % 128; @@ return (128 - length % 128) % 128; @@ GWMacBinaryTest.*:Carriers/* @@ fork padding after a whole number of blocks dropped
M52 @@ foundation/GWAppleDouble.cpp @@ constexpr std::uint32_t kAttributeMagic = 0x41545452;   // "ATTR" @@ constexpr std::uint32_t kAttributeMagic = 0x41545453;   // "ATTR" @@ GWAppleDoubleTest.*:Structures/* @@ AppleDouble attribute header magic wrong
M53 @@ tools/gwarchive/CommandExtract.cpp @@ integrity && !arguments.has("ignore-checksum")) { @@ integrity && arguments.has("ignore-checksum")) { @@ GWArchiveTool.*:Archives/GWArchiveToolXarVerdict.* @@ extract goes on past a bad table-of-contents checksum
M54 @@ tools/gwarchive/Diagnostics.cpp @@ return status == kExitSuccess && damaged ? kExitFailure : status; @@ return status; @@ GWArchiveTool.* @@ damage reported but exit status 0
M55 @@ tools/gwarchive/Diagnostics.cpp @@ if (byte < 0x20 || byte == 0x7F) @@ if (byte < 0x09 || byte == 0x7F) @@ GWArchiveTool.* @@ newlines and escapes in names printed raw
M56 @@ tools/gwarchive/JsonWriter.cpp @@ case '"': out += "\\\""; break; @@ case '"': out += "\""; break; @@ GWArchiveTool.* @@ quotes in JSON strings not escaped
M57 @@ foundation/GWRemoteFileHandle.cpp @@ url.scheme() == "http" || url.scheme() == "https"; @@ url.scheme() == "http" || url.scheme() == "httpz"; @@ GWRemoteFileHandleHTTPSTest.* @@ https locations refused
M58 @@ foundation/GWByteReader.cpp @@ value |= bigEndian ? byte << (8 * (width - 1 - i)) : byte << (8 * i); @@ value |= (bigEndian ? byte : byte) << (8 * i); @@ GWByteReader.*:GWXARArchiveOpen.* @@ big-endian reads come out little-endian
M59 @@ zip/GWZipUnicodePathCRC.cpp @@ if (stored != textCRC && stored == crc32Of(header)) { @@ if (stored != textCRC) { @@ *ExtraField*:GWZipArchiveOpen.* @@ Unicode path field adopted whatever name its CRC covers
M60 @@ zip/GWZipCentralDirectory.cpp @@ if (!(externalAttributes & kMSDOSReadOnlyAttribute)) { @@ if (externalAttributes & kMSDOSReadOnlyAttribute) { @@ GWZipArchiveOpen.*:GWZipFile* @@ MS-DOS read-only attribute inverted
M61 @@ zip/GWZipExtraFieldsUnix.cpp @@ GWZipSetInfo(info, kGWZipUserIDKey, field.u16le(8)); @@ GWZipSetInfo(info, kGWZipUserIDKey, field.u16le(10)); @@ *ExtraField* @@ PKWARE Unix field's user ID read from the group's place
M62 @@ zip/GWZipDecryption.cpp @@ if (flags & 0x0040) { @@ if (flags & 0x0080) { @@ PeerArchives/GWZipExtractEncrypted.*:GWZipArchiveExtraction.* @@ strong-encryption flag bit wrong
M63 @@ xar/GWXARLoadOperationTOC.cpp @@ if (count > 1) { @@ if (count > 2) { @@ GWXARArchiveHostileChecksum.*:GWXARArchiveOpen.* @@ two TOC checksum elements accepted
M64 @@ xar/GWXARTOCReferenceParser.cpp @@ if (lower == "sha256") { @@ if (lower == "sha-256") { @@ GWXARTOCValues.*:GWXARArchiveOpen.* @@ TOC checksum style "sha256" not known
M65 @@ xar/GWXARLoadOperationHeader.cpp @@ if (version != kSupportedVersion) { @@ if (version == 0) { @@ GWXARArchiveOpen.*:Headers/GWXARArchiveHostile.* @@ unknown XAR versions accepted
M66 @@ foundation/GWAppleDouble.cpp @@ if (version != kGWAppleDoubleVersion) { @@ if (version == 0) { @@ GWAppleDoubleTest.*:Structures/* @@ AppleDouble version not checked
M67 @@ applefile/GWMacBinaryHeader.cpp @@ if (bytes[1] < 1 || bytes[1] > 31) { @@ if (bytes[1] < 1 || bytes[1] > 63) { @@ GWMacBinaryTest.*:Headers/GWMacBinaryMalformedTest.* @@ MacBinary name length bound too wide
M68 @@ tools/gwarchive/CommandExtract.cpp @@ options.grants.keepSetIDBits = arguments.has("keep-setuid"); @@ options.grants.keepSetIDBits = !arguments.has("keep-setuid"); @@ Hostile/GWArchiveToolGrants.*:GWArchiveTool.* @@ --keep-setuid inverted
EOF

# Reads the list on stdin. list | check TREE | select ONLY | apply ID DIR
mutants_tool() {
    python3 - "$@" 3<<<"$MUTANTS" <<'PY'
import os, re, sys

def load():
    mutants = []
    with os.fdopen(3) as listing:
        for line in listing:
            if not line.strip():
                continue
            fields = [f.strip() for f in line.rstrip("\n").split("@@")]
            if len(fields) != 6:
                sys.exit(f"malformed mutant line: {line!r}")
            ident, path, original, replacement, hint, what = fields
            mutants.append(dict(id=ident, path=path, original=original.replace("\\n", "\n"),
                                replacement=replacement.replace("\\n", "\n"), hint=hint, what=what))
    return mutants

def occurrences(root, m):
    try:
        with open(os.path.join(root, m["path"]), encoding="utf-8") as f:
            return f.read().count(m["original"])
    except FileNotFoundError:
        return -1

def select(mutants, only):
    if not only:
        return mutants
    wanted = set()
    number = lambda s: int(re.fullmatch(r"M?(\d+)", s.strip(), re.I).group(1))
    for part in only.split(","):
        try:
            low, _, high = part.partition("-")
            wanted.update(range(number(low), number(high or low) + 1))
        except AttributeError:
            sys.exit(f"bad id in --only: {part!r}")
    return [m for m in mutants if number(m["id"]) in wanted]

mode, args = sys.argv[1], sys.argv[2:]
mutants = load()
if mode == "list":
    for m in mutants:
        print(f"{m['id']}  {m['path']}: {m['what']}")
elif mode == "check":
    bad = 0
    for m in mutants:
        n = occurrences(args[0], m)
        if n != 1:
            bad += 1
            print(f"{m['id']} {m['path']}: original text found {n if n >= 0 else 'no file'} times, "
                  "expected once", file=sys.stderr)
        if m["original"] == m["replacement"]:
            bad += 1
            print(f"{m['id']}: replacement equals the original", file=sys.stderr)
    ids = [m["id"] for m in mutants]
    if len(set(ids)) != len(ids):
        bad += 1
        print("duplicate mutant ids", file=sys.stderr)
    sys.exit(1 if bad else 0)
elif mode == "select":
    for m in select(mutants, args[0] if args else ""):
        print("\t".join([m["id"], m["path"], m["hint"], m["what"]]))
elif mode == "apply":
    m = next(m for m in mutants if m["id"] == args[0])
    target = os.path.join(args[1], m["path"])
    with open(target, encoding="utf-8") as f:
        text = f.read()
    if text.count(m["original"]) != 1:
        sys.exit(f"{m['id']}: original text not found exactly once in {target}")
    with open(target, "w", encoding="utf-8") as f:
        f.write(text.replace(m["original"], m["replacement"]))
PY
}

usage() { sed -n '2,/^set -uo/p' "$0" | sed '$d' | sed 's/^# \{0,1\}//'; exit "${1:-0}"; }

script_dir=$(cd "$(dirname "$0")" && pwd)
tree=$(git -C "$script_dir" rev-parse --show-toplevel 2>/dev/null || dirname "$script_dir")
only="" scratch=/tmp/gwarchive-mutants time_limit="" jobs=2 hints=1 baseline=1
while (($#)); do
    case "$1" in
        -t|--tree) tree=$2; shift ;;
        -o|--only) only=$2; shift ;;
        -s|--scratch) scratch=$2; shift ;;
        -T|--time-limit) time_limit=$2; shift ;;
        -j|--jobs) jobs=$2; shift ;;
        --no-hints) hints=0 ;;
        --no-baseline) baseline=0 ;;
        -c|--check) mutants_tool check "$tree"; exit $? ;;
        -l|--list) mutants_tool list; exit 0 ;;
        -h|--help) usage 0 ;;
        *) echo "mutants.sh: unknown option $1" >&2; usage 64 ;;
    esac
    shift || usage 64
done
tree=$(cd "$tree" && pwd) || exit 64
mkdir -p "$scratch" && scratch=$(cd "$scratch" && pwd) || exit 64
src=$scratch/src build=$scratch/src/build logs=$scratch/logs
binary=$build/tests/gwarchive_tests

log() { printf '%s\n' "$*"; }

if ! mutants_tool check "$tree"; then
    log "mutants.sh: the list does not match $tree" >&2
    exit 1
fi
selection=$(mutants_tool select "$only") || exit 64
[[ -n $selection ]] || { log "mutants.sh: no mutant matches --only $only" >&2; exit 64; }

# The scratch copy mirrors the tree's files; only files whose content differs are
# copied, so make's timestamps stay truthful and the rebuild stays small.
sync_tree() {
    mkdir -p "$src" "$logs"
    local list
    if git -C "$tree" rev-parse --git-dir >/dev/null 2>&1; then
        list=$(git -C "$tree" ls-files --cached --others --exclude-standard)
    else
        list=$(cd "$tree" && find . -path './build*' -prune -o -type f -print | sed 's|^\./||')
    fi
    local file
    while IFS= read -r file; do
        [[ -f $tree/$file ]] || continue
        if ! cmp -s "$tree/$file" "$src/$file"; then
            mkdir -p "$(dirname "$src/$file")"
            cp "$tree/$file" "$src/$file"
        fi
    done <<<"$list"
    # Files the tree no longer has would still be globbed into the build.
    (cd "$src" && find . -path ./build -prune -o -type f -print | sed 's|^\./||') |
        grep -vxF -f <(printf '%s\n' "$list") | while IFS= read -r file; do rm -f "$src/$file"; done
    # Tests find the shared sample archives as ../shared from the source tree.
    if [[ -d $tree/../shared ]]; then
        ln -sfn "$(cd "$tree/../shared" && pwd)" "$scratch/shared"
    fi
}

build_tree() {  # $1: log file
    if [[ ! -f $build/CMakeCache.txt ]]; then
        local linker=()
        command -v ld.lld >/dev/null && linker=(-DCMAKE_EXE_LINKER_FLAGS=-fuse-ld=lld)
        cmake -S "$src" -B "$build" -DCMAKE_BUILD_TYPE=Release \
            -DCMAKE_CXX_COMPILER_LAUNCHER=ccache -DCMAKE_C_COMPILER_LAUNCHER=ccache \
            "${linker[@]}" >"$1" 2>&1 || return 1
    fi
    # Relative paths let objects built in other trees serve this one from the cache.
    CCACHE_BASEDIR=${CCACHE_BASEDIR:-/} cmake --build "$build" -j"$jobs" \
        --target gwarchive gwarchive_tests >>"$1" 2>&1
}

# A shard stopped mid-test can leave a test's tmpfs mounted in its TMPDIR.
clean_tmp() {  # $1: shard index
    local dir=$scratch/tmp$1 mounted
    while read -r _ mounted _; do
        [[ $mounted == "$dir"/* ]] && umount -l "$mounted" 2>/dev/null
    done </proc/mounts
    rm -rf "$dir"
}

# Runs the suite (or a filter of it) in two shards; sets verdict (pass, fail,
# timeout) and first (the first failing test, or where it hung or crashed).
run_suite() {  # $1: gtest filter, $2: time limit, $3: log prefix
    local filter=$1 limit=$2 prefix=$3 index pids=() finished status=0 other
    for index in 0 1; do
        clean_tmp "$index"
        mkdir -p "$scratch/tmp$index"
        (
            export TMPDIR=$scratch/tmp$index GTEST_TOTAL_SHARDS=2 GTEST_SHARD_INDEX=$index
            cd "$build/tests" || exit 1
            exec setsid timeout -k 15 "$limit" "$binary" --gtest_fail_fast \
                --gtest_filter="$filter" --gtest_color=no
        ) >"$prefix.shard$index.log" 2>&1 </dev/null &
        pids+=($!)
    done
    verdict=pass first=""
    local remaining=("${pids[@]}") left
    while ((${#remaining[@]})); do
        wait -n -p finished "${remaining[@]}"
        status=$?
        left=()
        for other in "${remaining[@]}"; do
            [[ $other == "$finished" ]] || left+=("$other")
        done
        remaining=("${left[@]}")
        if ((status != 0)); then
            for other in "${remaining[@]}"; do
                kill -TERM -- "-$other" 2>/dev/null
            done
            for other in "${remaining[@]}"; do
                wait "$other" 2>/dev/null
            done
            index=0
            [[ $finished == "${pids[1]}" ]] && index=1
            local shard_log=$prefix.shard$index.log
            if ((status == 124 || status == 137)); then
                verdict=timeout
                first="hung in $(grep -a '^\[ RUN      \]' "$shard_log" | tail -1 | awk '{print $4}')"
            else
                verdict=fail
                first=$(grep -a -m1 '^\[  FAILED  \] [^ ]*\.' "$shard_log" | awk '{print $4}' | sed 's/,$//')
                if [[ -z $first ]]; then
                    first="crashed in $(grep -a '^\[ RUN      \]' "$shard_log" | tail -1 |
                        awk '{print $4}') (status $status)"
                fi
            fi
            break
        fi
    done
    for index in 0 1; do clean_tmp "$index"; done
}

# A test that fails under the load of the whole suite but passes alone may be
# flaky rather than caught: then the run is repeated once and its verdict stands.
run_confirmed() {  # $1: gtest filter, $2: time limit, $3: log prefix
    run_suite "$@"
    [[ $verdict == fail && $first != "crashed in"* ]] || return 0
    local suspect=$first
    clean_tmp 0
    mkdir -p "$scratch/tmp0"
    if (cd "$build/tests" && TMPDIR=$scratch/tmp0 timeout -k 15 "$2" "$binary" \
        --gtest_filter="$suspect" --gtest_color=no >"$3.alone.log" 2>&1 </dev/null); then
        clean_tmp 0
        run_suite "$1" "$2" "$3.again"
        [[ $verdict == pass ]] && notes+="$suspect failed once, passed alone and on a rerun; "
    fi
    clean_tmp 0
}

started=$(date +%s)
log "mutants.sh: tree $tree ($(git -C "$tree" describe --always --dirty 2>/dev/null || echo 'not git')), scratch $scratch"
log "started $(date -u '+%Y-%m-%d %H:%M:%S UTC')"
sync_tree
if ! build_tree "$logs/baseline.build.log"; then
    log "the unmutated tree does not build; see $logs/baseline.build.log"
    exit 2
fi
if ((baseline)); then
    t0=$(date +%s)
    notes=""
    run_confirmed '*' "${time_limit:-3600}" "$logs/baseline"
    baseline_seconds=$(($(date +%s) - t0))
    if [[ $verdict != pass ]]; then
        log "the unmutated tree does not pass ($verdict: $first); see $logs/baseline.shard*.log"
        exit 2
    fi
    log "unmutated suite passes in ${baseline_seconds}s${notes:+ (flaky: $notes)}"
    : "${time_limit:=$((2 * baseline_seconds + 120))}"
fi
: "${time_limit:=900}"
log "time limit per test run: ${time_limit}s"
log ""

killed=0 survived=0 broken=0 total=0 survivors=()
# Interrupted mid-mutant, the scratch copy gets its file back (the next run's sync would too).
current=""
trap '[[ -n $current ]] && cp "$scratch/original" "$src/$current"; exit 130' INT TERM
while IFS=$'\t' read -r id path hint what; do
    total=$((total + 1))
    t0=$(date +%s)
    cp "$src/$path" "$scratch/original"
    current=$path
    if ! mutants_tool apply "$id" "$src" 2>"$logs/$id.apply.log"; then
        outcome="not-applied" detail=$(head -1 "$logs/$id.apply.log")
        broken=$((broken + 1))
    elif ! build_tree "$logs/$id.build.log"; then
        outcome="build-failed" detail="see $logs/$id.build.log"
        broken=$((broken + 1))
    else
        verdict=pass first="" phase="" notes=""
        if ((hints)) && [[ -n $hint ]]; then
            run_confirmed "$hint" "$time_limit" "$logs/$id.hint"
            phase=" [hint]"
        fi
        if [[ $verdict == pass ]]; then
            rest='*' phase=""
            ((hints)) && [[ -n $hint ]] && rest="-$hint"
            run_confirmed "$rest" "$time_limit" "$logs/$id.rest"
        fi
        first+=$phase
        case $verdict in
            pass) outcome=survived detail=${notes:+"(flaky: $notes)"} survivors+=("$id"); survived=$((survived + 1)) ;;
            timeout) outcome=killed detail="timeout: $first"; killed=$((killed + 1)) ;;
            *) outcome=killed detail=$first; killed=$((killed + 1)) ;;
        esac
    fi
    # A new timestamp, so the next build recompiles the restored file.
    cp "$scratch/original" "$src/$path"
    current=""
    printf '%-4s %-44s %-12s %-55s %s (%ss)\n' "$id" "$path" "$outcome" "$what" "$detail" \
        "$(($(date +%s) - t0))"
done <<<"$selection"

log ""
log "totals: $total mutants, $killed killed, $survived survived, $broken not applied or not built"
((survived)) && log "survivors: ${survivors[*]}"
log "finished $(date -u '+%Y-%m-%d %H:%M:%S UTC'), $(($(date +%s) - started))s in all"
# Leaves the scratch build unmutated for the next run.
build_tree "$logs/restore.build.log" || true
((broken == 0))
