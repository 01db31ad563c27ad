#!/usr/bin/env bash
# Runs a local demonstration of kest-iam against the bundled test domain server.
set -euo pipefail
top=$(cd "$(dirname "$0")/.." && pwd)
. "$top/tools/deps.sh"
kest_ensure_packages
echo "kest-iam: the daemons are not built yet; this demonstration will walk through them once they exist."
echo "For now, build and test the foundation with: $top/tools/test.sh"
