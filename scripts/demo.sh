#!/usr/bin/env bash
# Runs the daemon's main job end to end in a throw-away home under build/:
# a local HTTPS receiver, a configuration bag, generated sessions and custom
# feedback, one flush through fbfctl, and a short report of what happened.
set -euo pipefail

BUILD=${1:-build/release}
BIN=$(cd "$BUILD/bin" && pwd)
ROOT=$(pwd)/build/demo-home
SESSIONS=${DEMO_SESSIONS:-300}
CUSTOM=${DEMO_CUSTOM:-40}

rm -rf "$ROOT"
mkdir -p "$ROOT"/{cache/vireond/Cohorts,config,state,data/applications,share,run,tls}
chmod 700 "$ROOT/run"
export HOME=$ROOT XDG_CACHE_HOME=$ROOT/cache XDG_CONFIG_HOME=$ROOT/config XDG_STATE_HOME=$ROOT/state \
       XDG_DATA_HOME=$ROOT/data XDG_DATA_DIRS=$ROOT/share XDG_RUNTIME_DIR=$ROOT/run
export VIREON_FBF_LOG_LEVEL=${VIREON_FBF_LOG_LEVEL:-info}

pids=()
cleanup() { for p in "${pids[@]}"; do kill "$p" 2>/dev/null || true; done; wait 2>/dev/null || true; }
trap cleanup EXIT

echo "== a self-signed certificate for 127.0.0.1"
openssl req -x509 -newkey rsa:2048 -nodes -days 2 -subj /CN=127.0.0.1 \
  -addext subjectAltName=IP:127.0.0.1 -keyout "$ROOT/tls/key.pem" -out "$ROOT/tls/cert.pem" 2>/dev/null

echo "== the receiver"
"$BIN/fbf-ingest" --listen 127.0.0.1:0 --port-file "$ROOT/ingest.port" --tls "$ROOT/tls/cert.pem" "$ROOT/tls/key.pem" \
  --record "$ROOT/uploads.jsonl" 2>"$ROOT/ingest.log" &
pids+=($!)
for _ in $(seq 100); do [ -s "$ROOT/ingest.port" ] && break; sleep 0.1; done
PORT=$(cat "$ROOT/ingest.port")
echo "   listening on https://127.0.0.1:$PORT"

echo "== configuration bag and preferences"
python3 - "$ROOT/cache/vireond/bag.plist" "$PORT" <<'PY'
import plistlib, sys
with open(sys.argv[1], "wb") as f:
    plistlib.dump({
        "feedback_url": f"https://127.0.0.1:{sys.argv[2]}/feedback",
        "crowdsourcing_url": f"https://127.0.0.1:{sys.argv[2]}/crowdsourcing",
        "feedback_max_age_in_days": 7,
        "vireon_feedback_format": "FeedbackV2PB",
        "cohorts_lookback_in_days": 56,
    }, f)
PY
"$BIN/fbfctl" defaults write vireond VIRUploadCAFile -string "$ROOT/tls/cert.pem"
"$BIN/fbfctl" defaults write vireond FBFNoExit -bool true
"$BIN/fbfctl" defaults write vireon.privacy DiagnosticsAndUsageEnabled -bool true

echo "== $SESSIONS sessions and $CUSTOM custom feedback files"
"$BIN/fbf-sessiongen" --out "$ROOT/cache/vireond" --sessions "$SESSIONS" --custom "$CUSTOM" --seed 7 --days 3
du -sh "$ROOT/cache/vireond" | awk '{print "   on disk: " $1}'

echo "== sample applications for the whitelist"
if [ -f scripts/demo-apps.sh ]; then bash scripts/demo-apps.sh "$ROOT"; fi

echo "== the daemon"
${DEMO_DAEMON_WRAPPER:-} "$BIN/vireon-fbf" 2>"$ROOT/daemon.log" &
pids+=($!)
for _ in $(seq 100); do [ -S "$ROOT/run/vireon-fbf.sock" ] && break; sleep 0.1; done

start=$(date +%s.%N)
"$BIN/fbfctl" flush
end=$(date +%s.%N)

if "$BIN/fbfctl" update-whitelists now >"$ROOT/whitelist.out" 2>&1; then
  echo "   whitelist signature: $(cat "$ROOT/whitelist.out")"
fi

echo
echo "== report"
python3 - "$ROOT" "$start" "$end" <<'PY'
import json, os, sys, collections
root, start, end = sys.argv[1], float(sys.argv[2]), float(sys.argv[3])
by_type = collections.Counter(); raw = comp = 0; ok = bad = 0
path = os.path.join(root, "uploads.jsonl")
for line in open(path) if os.path.exists(path) else []:
    r = json.loads(line)
    by_type[r.get("type") or "?"] += 1
    raw += r.get("inflated_size", 0); comp += r.get("body_size", 0)
    ok += 1 if r.get("digest_ok") else 0; bad += 0 if r.get("digest_ok") else 1
print(f"uploads by type:   {dict(by_type)}")
print(f"bytes:             {raw:,} before compression, {comp:,} after ({(comp / raw * 100 if raw else 0):.1f} %)")
print(f"digests verified:  {ok} ok, {bad} mismatched")
reasons = collections.Counter()
a = os.path.join(root, "state", "vireon-fbf", "analytics.jsonl")
for line in open(a) if os.path.exists(a) else []:
    reasons[json.loads(line)["payload"]["reason"]] += 1
names = {1: "too old", 2: "too large", 3: "empty", 4: "pruned", 5: "no consent", 12: "uploaded"}
print("deletion events:   " + ", ".join(f"{names.get(k, k)}: {v}" for k, v in sorted(reasons.items())))
left = collections.Counter()
cache = os.path.join(root, "cache", "vireond")
for dirpath, _, files in os.walk(cache):
    for f in files:
        if f.startswith("session."):
            left["session " + f.split(".")[3] + (" (upload pending)" if f.endswith(".uploadPending") else "")] += 1
        elif "CustomFeedback" in dirpath:
            left["custom " + os.path.basename(dirpath)] += 1
print(f"files left:        {dict(left) or 'none'}")
print(f"time taken:        {end - start:.2f} s for the flush")
PY
echo
"$BIN/fbfctl" status || true
