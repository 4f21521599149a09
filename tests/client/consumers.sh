#!/bin/sh
# SPDX-License-Identifier: Apache-2.0
# Installs the client library below PLACE and builds against it what others build: with pkg-config and with CMake, in each
# standard that it promises. The build lies in PLACE/bin, the library in PLACE/lib. Also sees that the library exports what its
# header declares and its Debian package promises.
# usage: consumers.sh SOURCES BUILD PLACE
set -eu
sources="$1" build="$2" place="$3"
examples="$sources/packaging/examples/client"
for part in library development python; do
    DESTDIR="$place" cmake --install "$build" --component "$part" >/dev/null
done
library="$(dirname "$(find "$place" -name libzorvane.so)")"
ln -s "$library" "$place/lib"
export PKG_CONFIG_PATH="$library/pkgconfig" PKG_CONFIG_SYSROOT_DIR="$place"

warnings='-Wall -Wextra -Wpedantic -Werror'
cFlags="-std=$(pkg-config --variable=c_standard zorvane)" cxxFlags="-std=$(pkg-config --variable=cxx_standard zorvane)"
mkdir "$place/bin"
cc "$cFlags" $warnings "$examples/notes.c" $(pkg-config --cflags --libs zorvane) -o "$place/bin/c99"
c++ "$cxxFlags" $warnings "$examples/notes.cc" $(pkg-config --cflags --libs zorvane) -o "$place/bin/cxx17"
env -u PKG_CONFIG_SYSROOT_DIR cmake -S "$examples" -B "$place/cmake" -Dzorvane_DIR="$library/cmake/zorvane" -DCMAKE_RUNTIME_OUTPUT_DIRECTORY="$place/bin" >/dev/null
cmake --build "$place/cmake" >/dev/null

exported="$(nm -D --defined-only "$library/libzorvane.so" | sed -n 's/.* T \(zorvane_[a-z0-9_]*\)@@ZORVANE_0$/\1/p' | sort)"
declared="$(cc -E -P "$sources/client/include/zorvane/zorvane.h" | grep -o 'zorvane_[a-z0-9_]*(' | tr -d '(' | sort -u)"
promised="$(sed -n 's/^ \(zorvane_[a-z0-9_]*\)@ZORVANE_0 .*/\1/p' "$sources/debian/libzorvane0.symbols" | sort)"
[ "$exported" = "$declared" ] || { echo "zorvane.h declares other functions than the library has" >&2; exit 1; }
[ "$exported" = "$promised" ] || { echo "debian/libzorvane0.symbols names other functions than the library has" >&2; exit 1; }
