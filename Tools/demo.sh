#!/usr/bin/env bash
# The main job, from nothing, on a scratch root: the daemon is started, creates containers for two
# applications of one user, for an enterprise persona, a group and a system container; an
# application is registered with its groups and removed with them; what stays is found again after a
# restart; a client without rights is refused. Everything is removed at the end.
#
# TESSARY_BUILD names the build directory.
set -euo pipefail

build=${TESSARY_BUILD:?the build directory}
root=$(mktemp -d)
chmod 755 "$root"
root=$(realpath "$root")
daemon=

stop_daemon() {
  [[ -n $daemon ]] || return 0
  kill "$daemon"
  wait "$daemon"
  daemon=
}

clean_up() {
  [[ -z $daemon ]] || kill -KILL "$daemon" 2>/dev/null || true
  rm -rf "$root"
}
trap clean_up EXIT

platform() { "$build/tessary-platform" --root "$root" "$@"; }

start_daemon() {
  TESSARY_LOG_LEVEL=error "$build/tessaryd" --root "$root" &
  daemon=$!
  for _ in $(seq 200); do
    "$build/tessaryctl" --root "$root" personas >/dev/null 2>&1 && return
    sleep 0.05
  done
  echo "the daemon does not answer" >&2
  exit 1
}

title() { printf '\n== %s\n' "$*"; }

# tessaryctl with every right
control() {
  echo "\$ root: tessaryctl $*"
  "$build/tessaryctl" --root "$root" "$@"
}

# as IDENTIFIER [OPTIONS of run] -- ARGUMENTS of tessaryctl
as() {
  local identifier=$1 options=()
  shift
  while [[ $1 != -- ]]; do
    options+=("$1")
    shift
  done
  shift
  echo "\$ $identifier: tessaryctl $*"
  platform run --identifier "$identifier" "${options[@]}" -- \
    "$build/tessaryctl" --root "$root" "$@" | sed "s#$root##"
}

# The class directories with what is in them: mode, owner, protection class, path.
show_tree() {
  local path class
  (cd "$root/private/var" && find mobile/Containers mobile/Enterprise containers -mindepth 2 2>/dev/null) |
    sort | while read -r path; do
    class=$(getfattr --only-values -n trusted.tessary.protection-class \
      "$root/private/var/$path" 2>/dev/null || echo 0)
    printf '%s  class %-2s /private/var/%s\n' \
      "$(stat -c '%A %6u:%-10u' "$root/private/var/$path" 2>/dev/null)" "$class" "$path"
  done
}

title "a device with one user, a personal and an enterprise persona"
platform init
mkdir -p "$root/private/var/mobile/Enterprise"
[[ $EUID -ne 0 ]] || chown 501:501 "$root/private/var/mobile/Enterprise"
platform persona add --unique-string PERSONAL --id 501 --kind personal
platform persona add --unique-string WORK --id 600 --kind enterprise \
  --layout-path /private/var/mobile/Enterprise --bundle com.example.office

title "the daemon starts"
start_daemon
echo "tessaryd --root $root runs as process $daemon"

entitlements=$root/entitlements.plist
cat >"$entitlements" <<'END'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>com.veltra.private.Tessary.lookup</key>
  <dict>
    <key>appGroup</key><array><string>group.com.example.shared</string></array>
  </dict>
</dict></plist>
END
chmod 644 "$entitlements"

title "two applications create their containers; each needs no right for its own"
as com.example.notes -- create --class 2
as com.example.photos -- create --class 2

title "an application of the enterprise persona: its container lies in the persona's own home"
as com.example.office --persona WORK -- create --class 2

title "a group container, for an application entitled to look it up"
as com.example.notes --entitlements "$entitlements" -- create --class 7 group.com.example.shared

title "a well-known system container, under its own name"
as com.example.notes -- system-path com.veltra.exampled

title "the installer registers an application with two groups; each gets a container"
cat >"$root/office.plist" <<'END'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>com.veltra.security.application-groups</key>
  <array><string>group.com.example.office</string><string>group.com.example.drafts</string></array>
</dict></plist>
END
control register com.example.office --entitlements "$root/office.plist" --class 2
control create --class 1 com.example.office
control groups com.example.office

title "what is on the disk"
show_tree

title "the application goes: what was registered for it goes too, and with it the group containers"
control delete --class 1 com.example.office
control list --class 7

title "a client without rights asks for another's container"
if as com.example.spy -- lookup --class 2 com.example.photos; then
  echo "this must not succeed" >&2
  exit 1
fi

title "the daemon ends and starts again; the containers are found"
stop_daemon
start_daemon
as com.example.notes -- lookup --class 2
as com.example.office --persona WORK -- lookup --class 2
control list --class 2

stop_daemon
title "done; the scratch root is removed"
