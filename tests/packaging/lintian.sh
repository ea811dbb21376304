# lintian, Debian's package checker, passes the three packages with no error
# and no warning. Overrides live in the packages
# (/usr/share/lintian/overrides/<package>, from
# cmake/debian/lintian-overrides.in), each with a comment that proves it right.
source "$(dirname "$0")/common.sh"

command -v lintian >/dev/null || { echo "FAIL: lintian is not installed"; exit 1; }
out="$SCRATCH/out"
make_debs "$out"
debs=("$out/$runtime_deb" "$out/$dev_deb")
[ "${HAS_PROBE:-0}" = 1 ] && debs+=("$out/$tools_deb")
for deb in "${debs[@]}"; do
  [ -f "$deb" ] || fail "$(basename "$deb") was not made"
done
[ "$failures" -eq 0 ] || finish

# Informational tags are shown too; of them only the hardening ones (a
# binary built without full RELRO or _FORTIFY_SOURCE) fail the test.
set +e
lintian --display-info --fail-on error,warning --tag-display-limit 0 "${debs[@]}" \
  >"$SCRATCH/lintian.txt" 2>&1
rc=$?
set -e
cat "$SCRATCH/lintian.txt"
if [ "$rc" -eq 0 ] && ! grep -Eq '^[EW]: ' "$SCRATCH/lintian.txt"; then
  pass "lintian: no errors, no warnings on ${#debs[@]} packages"
else
  fail "lintian found errors or warnings (exit $rc)"
fi
if grep -Eq '^.: [^ ]+ hardening-' "$SCRATCH/lintian.txt"; then
  fail "lintian: a packaged binary lacks hardening"
else
  pass "lintian: packaged binaries hardened"
fi
finish
