#!/usr/bin/env bash
# Checks the Android files that a build host can check without an Android tree:
#   1. the SELinux policy (android/sepolicy/reserveblocks.te), expanded with m4 for user and
#      for userdebug builds against stand-ins of the platform macros (android/check/macros.m4)
#      and compiled with checkpolicy together with a stand-in of the platform types and classes
#      it refers to (android/check/head.conf, tail.conf); a stray quote in a comment, an
#      unknown type, class, permission or macro fails here; the user build must grant none of
#      the access that the platform forbids there; every type the context files name must be
#      declared;
#   2. android/Android.bp, parsed and formatted by Blueprint's own bpfmt: a parse error or any
#      formatting difference fails.
# Installs m4, checkpolicy and blueprint-tools when they are missing (needs root then).
#   bash scripts/check-android.sh
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/install_missing.sh
install_missing m4 checkpolicy blueprint-tools

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
status=0
fail() {
  echo "check-android: $*" >&2
  status=1
}

policy=android/sepolicy/reserveblocks.te
for variant in user userdebug; do
  conf=$work/policy.$variant.conf
  # As the platform build expands it: m4 -s, so that checkpolicy names the policy's own lines.
  if ! m4 --fatal-warnings -s -D target_build_variant=$variant android/check/macros.m4 \
    android/check/head.conf "$policy" android/check/tail.conf >"$conf"; then
    fail "$policy: m4 failed for a $variant build"
    continue
  fi
  # Android 8.1 compiles policy version 30.
  checkpolicy -c 30 -o "$work/policy.$variant" "$conf" >"$work/log" 2>&1 ||
    fail "$policy: does not compile for a $variant build:
$(cat "$work/log")"
done
if grep -E '^ *allow .*(sys_rawio|misc_block_device)' "$work/policy.user.conf" >&2; then
  fail "$policy: a user build grants what the platform forbids there (above)"
fi
if ! grep -q -E '^ *allow .*sys_rawio' "$work/policy.userdebug.conf"; then
  fail "$policy: a userdebug build lacks CAP_SYS_RAWIO"
fi
for contexts in android/sepolicy/file_contexts android/sepolicy/property_contexts; do
  for type in $(grep -o -E 'u:object_r:[a-z0-9_]+:s0' "$contexts" | cut -d: -f3 | sort -u); do
    grep -q -E "^type $type," "$policy" || fail "$contexts: type $type is not declared in $policy"
  done
done

# bpfmt exits 0 on a difference and shows it with -d; it exits nonzero on a parse error.
if ! bpfmt -d android/Android.bp >"$work/bp.diff" 2>&1; then
  fail "android/Android.bp: does not parse:
$(cat "$work/bp.diff")"
elif [ -s "$work/bp.diff" ]; then
  fail "android/Android.bp: not formatted as bpfmt formats it:
$(cat "$work/bp.diff")"
fi

[ "$status" -eq 0 ] && echo "check-android: the SELinux policy compiles (user, userdebug); Android.bp is well formed"
exit "$status"
