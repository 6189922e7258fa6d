#!/usr/bin/env bash
# A program outside the tree builds against the installed libzlka-client with nothing but
# `pkg-config zlka-client`, and reaches a bus through it.
#   installed_library_test.sh BUILD_DIR CXX
set -euo pipefail
build=$1 cxx=$2
work=$(mktemp -d)
bus_pid=
trap '[[ -n $bus_pid ]] && kill "$bus_pid"; rm -rf "$work"' EXIT

for component in client client-dev; do
  DESTDIR="$work/root" cmake --install "$build" --component "$component" >/dev/null
done
pc=$(find "$work/root" -name zlka-client.pc)
[[ -n $pc ]] || { echo "zlka-client.pc was not installed" >&2; exit 1; }
export PKG_CONFIG_PATH=$(dirname "$pc") PKG_CONFIG_SYSROOT_DIR="$work/root"

# A private bus with no zlkad on it: the call gets as far as the bus, which answers ServiceUnknown.
cat >"$work/bus.conf" <<XML
<busconfig><type>session</type><listen>unix:path=$work/socket</listen>
<policy context="default"><allow send_destination="*"/><allow receive_sender="*"/><allow own="*"/></policy></busconfig>
XML
dbus-daemon --config-file="$work/bus.conf" --nofork --print-address=3 3>"$work/address" 2>/dev/null &
bus_pid=$!
for _ in $(seq 100); do [[ -s $work/address ]] && break; sleep 0.05; done

cat >"$work/caller.cpp" <<'CPP'
#include <zlka/client.h>
int main(int, char** argv) {
  zlka::ClientOptions options;
  options.bus = argv[1];
  auto client = zlka::Client::connect(options);
  if (!client) return 10;
  auto answer = client.value()->confirmActivation({zlka::Bytes{1, 2}, std::string("U")});
  return answer ? 11 : static_cast<int>(answer.error().code);
}
CPP
# C++17 on purpose: the installed header asks no more of an application.
# shellcheck disable=SC2046
"$cxx" -std=c++17 "$work/caller.cpp" -o "$work/caller" $(pkg-config --cflags --libs zlka-client)
libdir=$(pkg-config --variable=libdir zlka-client)
status=0
LD_LIBRARY_PATH="$libdir" "$work/caller" "$(head -n 1 "$work/address")" || status=$?
# 2: ServiceUnavailable, the call went out through the library and the bus answered.
[[ $status -eq 2 ]] || { echo "the caller exited with $status, not 2 (ServiceUnavailable)" >&2; exit 1; }
# The library needs libsystemd and the C and C++ runtimes, nothing of the daemon's.
needed=$(readelf -d "$libdir/libzlka-client.so" | sed -n 's/.*Shared library: \[\(.*\)\]/\1/p' | sort | tr '\n' ' ')
extra=$(tr ' ' '\n' <<<"$needed" | grep -Ev '^(libsystemd|libstdc\+\+|libgcc_s|libc|libm)\.so|^ld-linux|^$' || true)
[[ -z $extra ]] || { echo "libzlka-client.so needs $extra" >&2; exit 1; }
echo "built and ran against $libdir/libzlka-client.so (needs $needed)"
