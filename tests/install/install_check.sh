#!/usr/bin/env bash
# Configures a tree for the distribution's prefix (/usr), installs it into a DESTDIR, and checks
# that every file lands where its consumer reads it and names the paths it was installed to.
#
#   install_check.sh SOURCE_DIR TREE GENERATOR WERROR
set -euo pipefail
source_dir=$1 tree=$2 generator=$3 werror=$4

dest=$(mktemp -d)
trap 'rm -rf "$dest"' EXIT
# The same flags as the release tree, so that ccache serves the objects.
cmake -S "$source_dir" -B "$tree" -G "$generator" -DCMAKE_BUILD_TYPE=RelWithDebInfo -DZLKA_WERROR="$werror" \
  -DCMAKE_INSTALL_PREFIX=/usr -DZLKA_TESTS=OFF -DZLKA_SKIP=devserver >/dev/null
cmake --build "$tree" -j 2 >/dev/null
DESTDIR="$dest" cmake --install "$tree" >/dev/null

status=0
fail() {
  echo "FAIL: $*" >&2
  status=1
}
# Where this system's systemd and D-Bus daemon read their files.
var() { pkg-config --variable="$2" "$1"; }
unit=$dest$(var systemd systemdsystemunitdir)/zlkad.service
activation=$dest$(var dbus-1 system_bus_services_dir)/com.kestro.ZLKAuthentication.ZLKANetwork.service
for file in "$unit" "$activation" \
  "$dest$(var dbus-1 datadir)/dbus-1/system.d/com.kestro.ZLKAuthentication.conf" \
  "$dest$(var dbus-1 interfaces_dir)/com.kestro.ZLKAuthentication.ZLKANetworkProtocol.xml" \
  "$dest$(var systemd sysusersdir)/zlka.conf" "$dest$(var systemd tmpfilesdir)/zlka.conf" \
  "$dest/usr/share/doc/zlkad/examples/zlkad.toml" "$dest/usr/share/man/man1/zlkactl.1"; do
  [[ -f "$file" ]] || fail "not installed: ${file#"$dest"}"
done
[[ -x "$dest/usr/bin/zlkactl" ]] || fail "zlkactl is not in /usr/bin"

# The bus and systemd start the binary that was installed, with the configuration in /etc.
expected="/usr/sbin/zlkad --config /etc/zlka/zlkad.toml --bus system"
exec_line=$(sed -n 's/^Exec=//p' "$activation" 2>/dev/null)
exec_start=$(sed -n 's/^ExecStart=//p' "$unit" 2>/dev/null)
[[ "$exec_line" == "$expected" ]] || fail "activation file runs '$exec_line', not '$expected'"
[[ "$exec_start" == "$expected" ]] || fail "unit runs '$exec_start', not '$expected'"
[[ -x "$dest${exec_line%% *}" ]] || fail "the activation file's Exec= binary is not installed"

# Activation starts the unit; an [Install] section would start a daemon with no configuration.
grep -q '^\[Install\]' "$unit" 2>/dev/null && fail "the unit has an [Install] section"
[[ -e "$dest/etc/zlka/zlkad.toml" ]] && fail "the example configuration is installed as a live one"

for page in $(sed -n 's/^Documentation=//p' "$unit" 2>/dev/null); do
  [[ "$page" =~ ^man:(.+)\(([0-9])\)$ ]] || continue
  [[ -f "$dest/usr/share/man/man${BASH_REMATCH[2]}/${BASH_REMATCH[1]}.${BASH_REMATCH[2]}" ]] ||
    fail "the unit names $page, which is not installed"
done

leaks=$(grep -rIl /usr/local "$dest" || true)
[[ -z "$leaks" ]] || fail "installed files name /usr/local: ${leaks//$dest/}"

# The paths inside the unit were fixed for /usr: installing elsewhere must refuse, not mislead.
if DESTDIR="$dest/elsewhere" cmake --install "$tree" --prefix /opt/zlka >/dev/null 2>&1; then
  fail "cmake --install --prefix /opt/zlka into a tree configured for /usr succeeded"
fi

# systemd-analyze verify checks ExecStart against the running system, so the installed /usr/sbin is
# mounted over the real one in a mount namespace of its own.
if command -v systemd-analyze >/dev/null && [[ -f "$unit" ]]; then
  namespace=(unshare --mount --propagation private)
  [[ $(id -u) -eq 0 ]] || namespace=(unshare --map-root-user --mount --propagation private)
  if "${namespace[@]}" true 2>/dev/null; then
    MANPATH="$dest/usr/share/man" "${namespace[@]}" sh -c 'mount --bind "$1/usr/sbin" /usr/sbin && systemd-analyze verify "$2"' \
      sh "$dest" "$unit" || fail "systemd-analyze verify rejects the installed unit"
  else
    echo "systemd-analyze verify skipped: no mount namespace for this user"
  fi
fi
[[ $status -eq 0 ]] && echo "install layout: every file where its consumer reads it"
exit $status
