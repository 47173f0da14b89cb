#!/usr/bin/env bash
# Shows that the README's two commands work from nothing: removes the Debian packages the
# setup installs (and the benchmark peers and OpenImageIO's optional extras, whose presence
# once hid a missing install step), clones the committed state of this repository into a
# temporary folder and runs `make demo` and `make test` there, which must install what they
# need themselves. Needs root and changes the machine; not part of CI.
#   scripts/check-bare-setup.sh            # the checkout's HEAD
#   KEEP=1 scripts/check-bare-setup.sh     # keep the temporary clone for a look afterwards
set -euo pipefail
repo="$(cd "$(dirname "$0")/.." && pwd)"
[ "$(id -u)" -eq 0 ] || { echo "check-bare-setup: run as root (it removes packages)" >&2; exit 1; }

# What the Makefile's setup installs, less the compiler and make that run this at all.
read -r -a setup <<<"$(sed -n 's/^PACKAGES = //p' "$repo/Makefile")"
remove=()
for p in "${setup[@]}" openimageio-tools libopencv-dev libceres-dev; do
  case "$p" in g++|make) ;; *) remove+=("$p") ;; esac
done
echo "== removing: ${remove[*]}"
DEBIAN_FRONTEND=noninteractive apt-get remove --purge -y -qq "${remove[@]}" >/dev/null 2>&1 || true
DEBIAN_FRONTEND=noninteractive apt-get autoremove --purge -y -qq >/dev/null 2>&1 || true
for p in "${remove[@]}"; do
  if dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed'; then
    echo "check-bare-setup: $p is still installed" >&2
    exit 1
  fi
done

work="$(mktemp -d)"
[ -n "${KEEP:-}" ] || trap 'rm -rf "$work"' EXIT
git clone -q "$repo" "$work/plano"
cd "$work/plano"
echo "== $(git log -1 --format='%h %s')"
echo "== make demo"
make demo
echo "== make test"
make test
echo "== check-bare-setup: both commands passed from a fresh clone"
