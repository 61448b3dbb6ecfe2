#!/bin/sh
# Runs pelmora-config as a user would: values set, read, removed and carried through every
# syntax, plain and gzip-compressed; malformed files and wrong arguments.
set -u
tool=$1
dir=$(mktemp -d)
trap 'rm -rf "$dir"' EXIT
cd "$dir" || exit 1
fail() { echo "FAIL: $*"; exit 1; }
is_gzip() { [ "$(od -An -tx1 -N2 "$1" | tr -d ' ')" = "1f8b" ]; }

"$tool" --help | grep -q "convert FILE --to" || fail "--help"
"$tool" 2>/dev/null; [ $? -eq 2 ] || fail "no arguments must exit 2"
"$tool" get a.xml 2>/dev/null; [ $? -eq 2 ] || fail "get without a path must exit 2"
"$tool" convert a.xml --to json 2>/dev/null; [ $? -eq 2 ] || fail "unknown syntax must exit 2"

# set creates the file; values with blanks at either end survive every syntax.
"$tool" set a.xml log/level info || fail "set"
"$tool" set a.xml "pelmora/http/port" 8080 || fail "set 2"
"$tool" set a.xml "name[0001]/text" "  two blanks then one " || fail "set 3"
grep -q "<level>info</level>" a.xml || fail "xml content: $(cat a.xml)"
[ "$("$tool" get a.xml log/level)" = info ] || fail "get"
"$tool" convert a.xml --to properties --output b.properties || fail "to properties"
grep -q "^pelmora.http.port = 8080$" b.properties || fail "properties content: $(cat b.properties)"
"$tool" convert b.properties --to flat --output c.conf || fail "to flat"
grep -q '^log/level = "info"$' c.conf || fail "flat content: $(cat c.conf)"
"$tool" convert c.conf --to xml --output d.xml || fail "back to xml"
for f in a.xml b.properties c.conf d.xml; do
  [ "$("$tool" get $f "name[0001]/text")" = "  two blanks then one " ] || fail "value through $f"
  [ "$("$tool" get $f pelmora/http/port)" = 8080 ] || fail "port through $f"
done

# gzip: written compressed, read by content, kept compressed on change.
"$tool" convert a.xml --to flat --gzip --output e.gz || fail "convert --gzip"
is_gzip e.gz || fail "not gzip"
[ "$("$tool" --syntax flat get e.gz log/level)" = info ] || fail "get from gzip"
"$tool" --syntax flat set e.gz log/level trivia || fail "set in gzip"
is_gzip e.gz || fail "set must keep gzip"
[ "$(gzip -dc e.gz | grep level)" = 'log/level = "trivia"' ] || fail "gzip content"
"$tool" convert a.xml --to xml --gzip | gzip -dc | grep -q "<port>8080</port>" || fail "gzip to stdout"

# unset; a missing value is status 1 with one line.
chmod 640 a.xml
"$tool" unset a.xml log || fail "unset"
msg=$("$tool" get a.xml log/level 2>&1); [ $? -eq 1 ] || fail "get of an unset value must exit 1"
[ "$msg" = "pelmora-config: not set: log/level" ] || fail "message: $msg"
[ "$(stat -c %a a.xml)" = 640 ] || fail "a rewrite must keep the file's mode"
[ -e a.xml.tmp ] && fail "temporary file left behind"

# Malformed files and missing files: status 1, one line.
"$tool" check a.xml || fail "check of a good file"
printf '<a><b>x</b><b>y</b></a>' >bad.xml
msg=$("$tool" check bad.xml 2>&1); [ $? -eq 1 ] || fail "check of a malformed file must exit 1"
[ "$(echo "$msg" | wc -l)" -eq 1 ] || fail "one line: $msg"
echo "$msg" | grep -q "Duplicate child: b" || fail "message: $msg"
printf 'key without quotes\n' >bad.conf
"$tool" check bad.conf 2>/dev/null; [ $? -eq 1 ] || fail "check of a malformed flat file"
printf 'not gzip at all' | gzip -c | head -c 10 >bad.gz
"$tool" check bad.gz 2>/dev/null; [ $? -eq 1 ] || fail "check of a cut gzip file"
cp bad.xml before.xml
"$tool" set bad.xml a/c v 2>/dev/null; [ $? -eq 1 ] || fail "set on a malformed file must fail"
cmp -s bad.xml before.xml || fail "a failed set must leave the file alone"
msg=$("$tool" get missing.xml a 2>&1); [ $? -eq 1 ] || fail "missing file must exit 1"
echo "$msg" | grep -q "Failed to open read file" || fail "missing file message: $msg"
echo PASS
