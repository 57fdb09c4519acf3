#!/usr/bin/env bash
# installed_test.sh CHECK BUILD_DIR SOURCE_DIR
# Checks one aspect of berthd as installed from BUILD_DIR. Exits 0 when it
# holds, 77 (skipped, with the reason) when a tool it needs is missing, 1
# with the reason otherwise.
set -euo pipefail
check=$1
build=$(realpath "$2")
source_dir=$(realpath "$3")

fail() { echo "FAIL: $*" >&2; exit 1; }
skip() { echo "SKIP: $*" >&2; exit 77; }
need() { command -v "$1" >/dev/null || skip "$1 is not installed"; }

scratch=$(mktemp -d /tmp/berth-installed.XXXXXX)
daemon_pid=
cleanup() {
    [[ -n $daemon_pid ]] && kill -9 "$daemon_pid" 2>/dev/null || true
    rm -rf "$scratch"
}
trap cleanup EXIT

# The install tree under $scratch/stage, as a package would ship it.
stage() {
    DESTDIR=$scratch/stage cmake --install "$build" --prefix /usr >/dev/null
}

check_units() {
    need systemd-analyze
    stage
    local units=$scratch/stage/usr/lib/systemd/system
    [[ $(grep '^ExecStart=' "$units/berthd.service") == "ExecStart=/usr/libexec/berthd" ]] ||
        fail "the unit does not start the installed daemon: $(grep '^ExecStart=' "$units/berthd.service")"
    [[ -x $scratch/stage/usr/libexec/berthd ]] || fail "no installed daemon"
    grep -qx 'kernel.yama.ptrace_scope = 1' "$scratch/stage/usr/lib/sysctl.d/50-berthd.conf" ||
        fail "no setting that keeps a user's programs from attaching to launched apps"
    for program in berthctl berth-launch; do
        [[ -x $scratch/stage/usr/bin/$program ]] || fail "no installed $program"
    done
    if command -v scdoc >/dev/null; then
        for page in man8/berthd.8 man1/berthctl.1 man1/berth-launch.1; do
            [[ -s $scratch/stage/usr/share/man/$page ]] || fail "no manual page $page"
        done
    fi
    # The units they depend on (sysinit.target, ...) come from this system.
    local root=$scratch/verify
    mkdir -p "$root/usr/lib/systemd/system"
    cp -a "$scratch/stage/." "$root/"
    cp -rn /lib/systemd/system/. "$root/usr/lib/systemd/system/" 2>/dev/null || true
    local output
    output=$(systemd-analyze verify --man=no --root="$root" \
        "$root/usr/lib/systemd/system/berthd.service" \
        "$root/usr/lib/systemd/system/berthd.socket" \
        "$root/usr/lib/systemd/system/berthd-upcall.socket" 2>&1) ||
        fail "systemd-analyze verify: $output"
    [[ -z $output ]] || fail "systemd-analyze verify complains: $output"
    grep -q '^Type=notify$' "$units/berthd.service" || fail "the service is not Type=notify"
    grep -q '^FileDescriptorName=sys.kelp.berthd$' "$units/berthd.socket" ||
        fail "the request socket is not named for the daemon"
    grep -q '^FileDescriptorName=sys.kelp.berthd.upcall$' "$units/berthd-upcall.socket" ||
        fail "the upcall socket is not named for the daemon"
}

# Candidates the bash completion offers after the words given.
complete_words() {
    PATH=$build/client:$PATH bash -c '
        source "$1"; shift
        COMP_WORDS=("$@"); COMP_CWORD=$(($# - 1))
        _berthctl
        printf "%s\n" "${COMPREPLY[@]}"' _ "$source_dir/packaging/completion/berthctl.bash" "$@"
}

check_completion() {
    local got
    got=$(complete_words berthctl cre)
    [[ $got == create ]] || fail "'berthctl cre' offers: $got"
    got=$(complete_words berthctl "")
    for sub in send create lookup list delete wipe sign lock unlock commands groups system-container \
        codesign usage protect upcall; do
        grep -qx "$sub" <<<"$got" || fail "'berthctl ' does not offer $sub: $got"
    done
    grep -q '__complete' <<<"$got" && fail "the completion offers its own hidden verb"
    got=$(complete_words berthctl info "")
    [[ $(sort <<<"$got" | tr '\n' ' ') == "get remove set " ]] || fail "'berthctl info ' offers: $got"
    got=$(complete_words berthctl create --class Data/)
    grep -qx 'Data/Application' <<<"$got" || fail "'--class Data/' offers: $got"
    grep -qx 'Data/SprocketPlugin' <<<"$got" || fail "'--class Data/' offers: $got"
    grep -q 'Bundle' <<<"$got" && fail "'--class Data/' offers other classes: $got"
    got=$(complete_words berthctl create --tr)
    [[ $got == --transient ]] || fail "'create --tr' offers: $got"
    got=$(complete_words berthctl create --js)
    [[ $got == --json ]] || fail "'create --js' offers: $got"
    [[ -f $source_dir/packaging/completion/_berthctl ]] || fail "no zsh completion"
    if command -v zsh >/dev/null; then zsh -n "$source_dir/packaging/completion/_berthctl" ||
        fail "the zsh completion does not parse"; fi
}

check_library() {
    need pkg-config
    stage
    local stage_dir=$scratch/stage
    local pc
    pc=$(dirname "$(find "$stage_dir" -name berth.pc)")
    cat >"$scratch/client.cpp" <<'PROGRAM'
#include <libberth/BerthConnection.h>
#include <iostream>
int main(int argc, char** argv) {
    berth::BerthError error;
    auto connection = berth::BerthConnection::connect(argv[1], &error);
    std::cout << (connection ? "connected" : "not running") << "\n";
    return connection ? 1 : 0;
}
PROGRAM
    local flags
    flags=$(PKG_CONFIG_SYSROOT_DIR=$stage_dir PKG_CONFIG_PATH=$pc pkg-config --cflags --libs berth)
    # shellcheck disable=SC2086
    g++ -o "$scratch/client" "$scratch/client.cpp" $flags || fail "a program cannot build with: $flags"
    local libdir
    libdir=$(dirname "$(find "$stage_dir" -name 'libberth.so')")
    [[ $(LD_LIBRARY_PATH=$libdir "$scratch/client" "$scratch/nothing") == "not running" ]] ||
        fail "the program linked with libberth does not run"
    # Whole output first: grep -q stopping early would kill ldd with SIGPIPE,
    # which pipefail counts as a failure.
    local linked
    linked=$(LD_LIBRARY_PATH=$libdir ldd "$scratch/client")
    grep -q "libberth.so.0 => $libdir" <<<"$linked" ||
        fail "the program does not use the installed shared libberth: $linked"
}

check_package() {
    need dpkg
    need cpack
    need systemd-sysusers
    [[ $(id -u) -eq 0 ]] || skip "installing a package into a scratch root needs root"
    (cd "$build" && cpack -G DEB >"$scratch/cpack.log" 2>&1) || fail "cpack: $(cat "$scratch/cpack.log")"
    local deb
    deb=$(ls -t "$build"/package/berthd_*.deb | head -n 1)
    local depends
    depends=$(dpkg-deb -f "$deb" Depends)
    for dep in libacl1 libssl3 libsystemd0 systemd bubblewrap; do
        grep -q "$dep" <<<"$depends" || fail "the package does not depend on $dep: $depends"
    done

    # dpkg's own database in the scratch root; the maintainer scripts run
    # outside it (chrootless) and prepare that root.
    local root=$scratch/root
    mkdir -p "$root/var/lib/dpkg/info" "$root/var/lib/dpkg/updates" "$root/etc"
    touch "$root/var/lib/dpkg/status"
    dpkg --root="$root" --force-script-chrootless --force-depends --force-not-root \
        --log=/dev/null -i "$deb" >"$scratch/dpkg.log" 2>&1 || fail "dpkg: $(cat "$scratch/dpkg.log")"
    grep -q '^mobile:x:501:' "$root/etc/passwd" || fail "the mobile user was not made"
    [[ $(stat -c %a "$root/etc/berthd/signatures") == 700 ]] || fail "the registry is not root's alone"

    BERTH_ROOT=$root "$root/usr/libexec/berthd" 2>"$scratch/berthd.stderr" &
    daemon_pid=$!
    local socket=$root/run/berthd/sys.kelp.berthd
    for _ in $(seq 200); do [[ -S $socket ]] && break; sleep 0.05; done
    [[ -S $socket ]] || fail "the installed daemon does not serve: $(cat "$scratch/berthd.stderr")"
    local listing
    listing=$(BERTH_ROOT=$root "$root/usr/bin/berthctl" commands) || fail "berthctl commands failed"
    grep -q createOrLookupContainer <<<"$listing" || grep -q '^ *0 ' <<<"$listing" ||
        fail "berthctl commands lists nothing: $listing"
    local created
    created=$(BERTH_ROOT=$root "$root/usr/bin/berthctl" create --class Data/Application \
        --user 501 --identifier com.example.packaged) || fail "the installed daemon refused: $created"
    grep -q "$root/private/var/mobile/Containers/Data/Application/" <<<"$created" ||
        fail "the container is not under the scratch root: $created"
}

case $check in
units) check_units ;;
completion) check_completion ;;
library) check_library ;;
package) check_package ;;
*) fail "unknown check $check" ;;
esac
echo "ok: $check"
