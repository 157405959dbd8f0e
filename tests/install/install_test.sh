#!/usr/bin/env bash
# Installs the build into a temporary prefix and uses it from there alone, as
# another project would: a C program through pkg-config, a C++ project through
# find_package(dpx), and a Java program against the installed jar, each
# putting and getting a file through the installed dpx-agentd. Then checks
# the units (systemd-analyze verify), the man pages (they render, and name
# every option and variable of --help), and, where the Debian tools are
# here, the packages (their contents, and no lintian error).
#
# usage: install_test.sh BUILD_DIR CONSUMERS_DIR
set -euo pipefail
build=$1 consumers=$2
work=$(mktemp -d)
prefix=$work/prefix
agentd_pid=
cleanup() {
    [[ -z $agentd_pid ]] || { kill "$agentd_pid"; wait "$agentd_pid" || true; }
    rm -rf "$work"
}
trap cleanup EXIT
fail() { echo "install test: $*" >&2; exit 1; }

cmake --install "$build" --prefix "$prefix" >/dev/null
cp -r "$consumers" "$work/consumers"
libdir=$(dirname "$(find "$prefix" -name libdpx.so.1 | head -1)")

# The installed daemon, with its own broker on a free port.
export NCS_LB_PORT
NCS_LB_PORT=$(python3 -c 'import socket; s = socket.socket(); s.bind(("127.0.0.1", 0)); print(s.getsockname()[1])')
export DPX_HUBHOST=127.0.0.1 TMPDIR=$work
mkdir -p "$work/depot/prod"
"$prefix/bin/dpx-agentd" --depot "$work/depot" --product prod --broker --hub >"$work/agentd.out" 2>"$work/agentd.err" &
agentd_pid=$!
for _ in $(seq 100); do grep -q "listening on" "$work/agentd.out" && break; sleep 0.05; done
grep -q "listening on" "$work/agentd.out" || fail "the installed dpx-agentd didn't start: $(cat "$work/agentd.err")"
head -c 300000 /dev/urandom >"$work/source.bin"

# check NAME TARGET: the get brought back what the put sent.
check() { cmp -s "$work/source.bin" "$2" || fail "$1: the file came back different"; echo "$1: put and get through the installed daemon"; }

cd "$work/consumers"
export PKG_CONFIG_PATH=$libdir/pkgconfig
# shellcheck disable=SC2046
cc -std=c11 -Wall -Wextra -Werror put_get.c $(pkg-config --cflags --libs dpx) -Wl,-rpath,"$libdir" -o put_get_c
./put_get_c "$work/source.bin" "$work/from-c.bin" >/dev/null || fail "the C program failed"
check "C through pkg-config" "$work/from-c.bin"

cmake -S cxx -B cxx-build -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build cxx-build >/dev/null
./cxx-build/put_get "$work/source.bin" "$work/from-cxx.bin" >/dev/null || fail "the C++ program failed"
check "C++ through find_package(dpx)" "$work/from-cxx.bin"

jar=$(find "$prefix" -name filetransferclient.jar | head -1)
if [[ -n $jar ]]; then
    javac -cp "$jar" -d java Installed.java
    java -Xcheck:jni -Djava.library.path="$libdir/jni" -cp "$jar:java" Installed "$work/source.bin" "$work/from-java.bin" \
        >/dev/null || fail "the Java program failed"
    check "Java against the installed jar" "$work/from-java.bin"
fi

units=$(find "$prefix" -path '*systemd/system' -type d)
if command -v systemd-analyze >/dev/null; then
    cp "$units/dpx-lbd.service" "$work/"
    cp "$units/dpx-agentd@.service" "$work/dpx-agentd@prod.service"
    systemd-analyze verify --man=no "$work/dpx-lbd.service" "$work/dpx-agentd@prod.service" 2>"$work/verify.err" ||
        fail "systemd-analyze verify: $(cat "$work/verify.err")"
    echo "units: systemd-analyze verify passes"
fi

# Every option and variable that --help names is in the man page.
for page in "$prefix"/share/man/man*/*.gz; do
    program=$(basename "${page%.*.gz}")
    MANWIDTH=80 man -l "$page" >/dev/null 2>"$work/man.err" && [[ ! -s $work/man.err ]] ||
        fail "man -l $page: $(cat "$work/man.err")"
    text=$(gzip -dc "$page" | sed 's/\\-/-/g')
    for word in $("$prefix/bin/$program" --help | grep -oE -- '--[a-z][a-z-]*|\b[A-Z][A-Z0-9]*_[A-Z0-9_]+\b' | sort -u); do
        grep -qF -- "$word" <<<"$text" || fail "$program --help names $word, its man page doesn't"
    done
    echo "$program: the man page renders and names all of --help"
done

if command -v dpkg-deb >/dev/null && command -v lintian >/dev/null; then
    (cd "$build" && cpack -G DEB -B "$work/packages" >/dev/null 2>"$work/cpack.err") || fail "cpack -G DEB: $(cat "$work/cpack.err")"
    for deb in "$work"/packages/*.deb; do
        contents=$(dpkg-deb -c "$deb")
        case $(basename "$deb") in
        libdpx1_*) wanted="libdpx.so.1 dpx/libncs.so jni/libdpx.so filetransferclient.jar" ;;
        libdpx-dev_*) wanted="dpx/dpx.h dpx/text.h platform/ncs/ncs.h pkgconfig/dpx.pc cmake/dpx/dpx-config.cmake libdpx.so" ;;
        dpx-tools_*) wanted="bin/dpx bin/dpx-agentd bin/dpx-lbd dpx-agentd@.service dpx-lbd.service man1/dpx.1.gz" ;;
        *) fail "unexpected package $deb" ;;
        esac
        for file in $wanted; do
            grep -q -- "$file" <<<"$contents" || fail "$(basename "$deb") lacks $file"
        done
        lintian --fail-on error --suppress-tags-from-file /dev/null "$deb" >"$work/lintian.out" 2>&1 ||
            fail "lintian on $(basename "$deb"): $(cat "$work/lintian.out")"
        echo "$(basename "$deb"): the files are there; lintian: $(grep -c '^[EW]:' "$work/lintian.out" || true) errors and warnings, no error"
    done
fi
