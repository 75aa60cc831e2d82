#!/usr/bin/env bash
# Sets everything up, builds the tools and runs the main job.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/setup.sh
bash scripts/build.sh release >/dev/null
exec build/release/tools/swsec info "$@"
