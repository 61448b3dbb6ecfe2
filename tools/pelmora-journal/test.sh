#!/bin/sh
# Runs pelmora-journal as a user would: on a journal a crash left open, on a finished one,
# on files that are not journals, and with wrong arguments.
set -u
tool=$1
dir=$(mktemp -d)
trap 'rm -rf "$dir"' EXIT
fail() { echo "FAIL: $*"; exit 1; }
u32() { printf "$(printf '\\%03o\\%03o\\%03o\\%03o' $(($1 & 255)) $(($1 >> 8 & 255)) $(($1 >> 16 & 255)) $(($1 >> 24 & 255)))"; }
str() { u32 $((${#1} + 1)); printf '%s\0' "$1"; }
# record BYTES-FILE: a length-prefixed record of that file's bytes
record() { u32 $(wc -c <"$1"); cat "$1"; }

"$tool" --help | grep -q "recover JOURNAL" || fail "--help"
"$tool" 2>/dev/null; [ $? -eq 2 ] || fail "no arguments must exit 2"
"$tool" frobnicate "$dir/x" 2>/dev/null; [ $? -eq 2 ] || fail "unknown command must exit 2"

# A journal left open: a directory and a file were created, no End.
mkdir "$dir/tree" "$dir/tree/made"
echo new >"$dir/tree/file"
{ u32 1280201290; u32 1; u32 0; u32 0; str "cli"; } >"$dir/h"
{ u32 1; } >"$dir/b"
{ u32 4; printf '\001'; str "$dir/tree/made"; } >"$dir/d"
{ u32 5; printf '\001'; u32 1; str "$dir/tree/file"; } >"$dir/f"
{ printf 'NORVEX.JOURNAL.VER.1.0.'; record "$dir/h"; record "$dir/b"; record "$dir/d"; record "$dir/f"; } >"$dir/j"

"$tool" check "$dir/j" || fail "check of a valid journal"
out=$("$tool" dump "$dir/j") || fail "dump"
echo "$out" | grep -q '^0 Header id "cli"' || fail "dump header: $out"
echo "$out" | grep -q "^2 Dir create \"$dir/tree/made\"" || fail "dump dir: $out"
echo "$out" | grep -q "^3 File create type 1 \"$dir/tree/file\"" || fail "dump file: $out"
"$tool" recover "$dir/j" | grep -q "undid" || fail "recover"
[ -e "$dir/tree/made" ] && fail "directory not undone"
[ -e "$dir/tree/file" ] && fail "file not undone"
"$tool" dump "$dir/j" | tail -1 | grep -q "End undone" || fail "recover must close the change"
"$tool" recover "$dir/j" | grep -q "nothing to undo" || fail "second recover"

# Not journals: another header text, a truncated header record, a missing file.
printf 'NORVEX.JOURNAL.VER.1.1.' >"$dir/other"
msg=$("$tool" check "$dir/other" 2>&1); [ $? -eq 1 ] || fail "check of a non-journal must exit 1"
[ "$(echo "$msg" | wc -l)" -eq 1 ] || fail "one line of error: $msg"
{ printf 'NORVEX.JOURNAL.VER.1.0.'; u32 20; head -c 20 /dev/zero; } >"$dir/short"
msg=$("$tool" dump "$dir/short" 2>&1); [ $? -eq 1 ] || fail "dump of a corrupt journal must exit 1"
echo "$msg" | grep -q "Buffer is too small" || fail "corrupt header message: $msg"
"$tool" check "$dir/missing" 2>/dev/null; [ $? -eq 1 ] || fail "missing file must exit 1"
echo PASS
