#!/bin/sh
# Runs pelmora-c14n as a user would: each case's output and exit status must match.
tool="$1"
dir=$(mktemp -d)
trap 'rm -rf "$dir"' EXIT
failures=0

expect() {  # name, expected status, expected output, command...
   name=$1 status=$2 expected=$3
   shift 3
   actual=$("$@" 2>"$dir/err")
   code=$?
   if [ "$code" != "$status" ] || [ "$actual" != "$expected" ]; then
      echo "FAIL $name: status $code (want $status), output [$actual] (want [$expected]), stderr: $(cat "$dir/err")"
      failures=$((failures + 1))
   fi
}

cat >"$dir/doc.xml" <<'XML'
<?xml version="1.0"?>
<s:Envelope xmlns:s="urn:s" xmlns:u="urn:u" xmlns="urn:d"><!-- c --><s:Body u:Id="b" z="1&gt;0"><op>a&lt;&lt;b</op></s:Body></s:Envelope>
XML

expect inclusive-file 0 '<s:Envelope xmlns="urn:d" xmlns:s="urn:s" xmlns:u="urn:u"><s:Body z="1&gt;0" u:Id="b"><op>a&lt;<b</op></s:Body></s:Envelope>' \
   "$tool" "$dir/doc.xml"
expect exclusive-path 0 '<s:Body xmlns:s="urn:s" xmlns:u="urn:u" z="1&gt;0" u:Id="b"><op xmlns="urn:d">a&lt;<b</op></s:Body>' \
   "$tool" --exclusive --path Envelope/Body "$dir/doc.xml"
expect exclusive-prefixes 0 '<s:Body xmlns="urn:d" xmlns:s="urn:s" xmlns:u="urn:u" z="1&gt;0" u:Id="b"><op>a&lt;<b</op></s:Body>' \
   "$tool" --exclusive --prefixes '#default' --path '*/Body' "$dir/doc.xml"
expect stdin 0 '<a b="1"></a>' sh -c "printf '<a b=\"1\"/>' | '$tool' -"
expect path-missing 1 '' "$tool" --path Envelope/Header "$dir/doc.xml"
expect not-well-formed 1 '' sh -c "printf '<a><b></a>' | '$tool'"
grep -q 'standard input:1: not well-formed XML: mismatched tag' "$dir/err" ||
   { echo "FAIL not-well-formed message: $(cat "$dir/err")"; failures=$((failures + 1)); }
expect no-file 1 '' "$tool" "$dir/absent.xml"
expect prefixes-without-exclusive 2 '' "$tool" --prefixes s "$dir/doc.xml"
expect unknown-option 2 '' "$tool" --comments "$dir/doc.xml"
expect two-files 2 '' "$tool" "$dir/doc.xml" "$dir/doc.xml"

[ "$failures" = 0 ] && echo "all cases passed"
[ "$failures" = 0 ]
