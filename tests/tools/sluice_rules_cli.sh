#!/usr/bin/env bash
# sluice-rules end to end: every example compiles, decodes to text that
# compiles to the same bytes, and lints clean; an oversized file is refused
# before it is read; diff with a capture names the packets that change;
# --json gives the same answers as documents.
set -euo pipefail
tool=$1
src=$2
tmp=$(mktemp -d)
trap 'rm -rf "$tmp"' EXIT
# Runs a command that must fail (a bare '!' would not stop the script).
fails() {
  if "$@"; then
    echo "unexpected success: $*" >&2
    exit 1
  fi
}

for rules in "$src"/examples/*.rules; do
  "$tool" check -q "$rules" >/dev/null
  "$tool" lint "$rules" >/dev/null
  "$tool" compile "$rules" "$tmp/a.bin" >/dev/null
  "$tool" decode "$tmp/a.bin" >"$tmp/a.rules"
  "$tool" compile "$tmp/a.rules" "$tmp/b.bin" >/dev/null
  cmp "$tmp/a.bin" "$tmp/b.bin"
done

# A 1 GiB file (sparse, no data written) is refused by size.
truncate -s 1G "$tmp/big.rules"
fails "$tool" check "$tmp/big.rules" 2>"$tmp/err"
grep -q "larger than 256 MiB" "$tmp/err"

# check and compile refuse the same text with the same located error.
printf 'action=drop\naction=gree\n' >"$tmp/bad.rules"
fails "$tool" check "$tmp/bad.rules" 2>"$tmp/check.err"
fails "$tool" compile "$tmp/bad.rules" "$tmp/bad.bin" 2>"$tmp/compile.err"
grep -q "bad.rules:2:8: error: unknown action 'gree'; did you mean 'gre'?" "$tmp/check.err"
cmp "$tmp/check.err" "$tmp/compile.err"

# Opening ssh to everyone changes exactly the one ssh packet of the demo.
sed 's/^action=drop ipv4 proto=tcp dport=22$/action=accept ipv4 proto=tcp dport=22/' \
  "$src/examples/web.rules" >"$tmp/open.rules"
fails "$tool" diff "$src/examples/web.rules" "$tmp/open.rules" --capture "$src/examples/demo.pcapng" >"$tmp/diff"
grep -q "^packet 4 (from switch): drop (general rule, line 8) -> accept (general rule, line 8)$" "$tmp/diff"
grep -q "^1 of 9 packets change verdict$" "$tmp/diff"
"$tool" diff "$src/examples/web.rules" "$src/examples/web.rules" | grep -q "^no differences$"

# --json: the same answers as one document each, errors located.
"$tool" check --json "$src/examples/web.rules" | python3 -c '
import json, sys
d = json.load(sys.stdin)
assert d["schema"] == 1 and d["command"] == "check", d
assert d["counts"]["rules"] == len(d["rules"]), d
assert all(r["table"] in ("exact", "general") for r in d["rules"]), d'
fails "$tool" check --json "$tmp/bad.rules" >"$tmp/err.json"
python3 -c '
import json, sys
e = json.load(open(sys.argv[1]))["errors"][0]
assert (e["line"], e["column"]) == (2, 8) and "gree" in e["message"], e' "$tmp/err.json"
fails "$tool" diff --json "$src/examples/web.rules" "$tmp/open.rules" \
  --capture "$src/examples/demo.pcapng" | python3 -c '
import json, sys
d = json.load(sys.stdin)
[p] = d["packets"]["changed"]
assert p["index"] == 4 and p["before"]["action"] == "drop" and p["after"]["action"] == "accept", p
assert [r["change"] for r in d["rules"]] == ["changed"], d'
