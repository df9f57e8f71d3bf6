#!/usr/bin/env bash
# CTest's launcher of the integration tests (their CROSSCOMPILING_EMULATOR):
# each test case runs in a test network of its own. See testnet.sh.
exec bash "$(dirname "$0")/testnet.sh" run "$@"
