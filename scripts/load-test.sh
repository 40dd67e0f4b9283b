#!/usr/bin/env bash
# The load test at its full size: 32 clients for 60 s on a store of 100,000 objects while the
# synchroniser pulls from 50 simulated cameras and the database path moves once. Prints the
# test's report (requests served and per second, the memory the server kept a quarter, half,
# three quarters in and at the end, faults if any).
# Sizes can be changed through the same variables: DELVIX_LOAD_CLIENTS, DELVIX_LOAD_SECONDS,
# DELVIX_LOAD_OBJECTS, DELVIX_LOAD_CAMERAS. Build directory: DELVIX_LOAD_BUILD_DIR (build-load).
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
BUILD_DIR=${DELVIX_LOAD_BUILD_DIR:-$ROOT/build-load}
JOBS=${DELVIX_JOBS:-2}

if [ ! -f "$BUILD_DIR/build.ninja" ]; then
  cmake -S "$ROOT" -B "$BUILD_DIR" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DDELVIX_BUILD_BENCH=OFF
fi
cmake --build "$BUILD_DIR" -j "$JOBS" --target test_Host delvix-host PluginDelvixSrv

export DELVIX_LOAD_CLIENTS=${DELVIX_LOAD_CLIENTS:-32}
export DELVIX_LOAD_SECONDS=${DELVIX_LOAD_SECONDS:-60}
export DELVIX_LOAD_OBJECTS=${DELVIX_LOAD_OBJECTS:-100000}
export DELVIX_LOAD_CAMERAS=${DELVIX_LOAD_CAMERAS:-50}
exec "$BUILD_DIR/bin/test_Host" --gtest_filter='HostLoad.*'
