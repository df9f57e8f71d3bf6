#!/usr/bin/env bash
# Installs the locked dependencies, builds www/dist and runs the unit tests.
# Called by CI; needs Node >= 20.19 and npm with the registry (or its cache).
set -euo pipefail
cd "$(dirname "$0")/.."
npm ci --no-audit --no-fund
npm run build
npm test
