#!/usr/bin/env bash
# Installs what is missing, builds the release preset, creates a simulated
# router appliance in ./demo-root (once) and serves the web API on it.
#
#   scripts/serve-demo.sh            # listens on 127.0.0.1:8080
#   TCAPI_LISTEN=127.0.0.1:9090 scripts/serve-demo.sh
set -euo pipefail

cd "$(dirname "${BASH_SOURCE[0]}")/.."

listen="${TCAPI_LISTEN:-127.0.0.1:8080}"
# curl for the example requests printed below.
bash scripts/install-deps.sh curl

cmake --preset release
cmake --build --preset release
tcapi=build/release/bin/tcapi

if [[ ! -e demo-root ]]; then
  "$tcapi" init-root demo-root --demo
fi

base="http://${listen}/api"
rule='{"enabled":true,"protocol":"tcp","minrate":1000,"maxrate":5000,"source":"all","ip_direction":"src","port_type":"SELF","port_num":"80,443","port_direction":"dest"}'
cat <<EOF

Example requests (one per method):

  curl -s -H 'Content-Type: application/json' -d '{"adapter":"eth0"}' ${base}/ORVI.Core.Network.TrafficControl.Rules/1/load
  curl -s -H 'Content-Type: application/json' -d '{"adapter":"eth0","rules":[${rule}]}' ${base}/ORVI.Core.Network.TrafficControl.Rules/1/save
  curl -s -H 'Content-Type: application/json' -d '{"direction":"upload"}' ${base}/ORVI.Core.Network.TrafficControl.RouterRules/1/load
  curl -s -H 'Content-Type: application/json' -d '{"direction":"upload","rules":[${rule}]}' ${base}/ORVI.Core.Network.TrafficControl.RouterRules/1/save

The same without a server: ${tcapi} call ORVI.Core.Network.TrafficControl.Rules load '{"adapter":"eth0"}' --root demo-root
Stop the server with Ctrl-C.

EOF
exec "$tcapi" serve --root demo-root --listen "$listen" --log-stderr
