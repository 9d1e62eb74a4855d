#!/usr/bin/env bash
# Sample installed applications and a small whitelist resource for the demo,
# so that `fbfctl update-whitelists now` there prints a real signature.
# Usage: demo-apps.sh ROOT, where ROOT/data is XDG_DATA_HOME and ROOT/share
# is the one directory of XDG_DATA_DIRS.
set -euo pipefail

ROOT=${1:?usage: demo-apps.sh ROOT}
USER_APPS=$ROOT/data/applications
SHARED_APPS=$ROOT/share/applications
umask 077
mkdir -p "$USER_APPS/vendor" "$SHARED_APPS" "$ROOT/share/vireond"

entry() {  # entry FILE NAME [EXTRA LINE]
  {
    printf '[Desktop Entry]\nType=Application\nName=%s\nExec=%s\n' "$2" "$(basename "$1" .desktop)"
    if [ $# -ge 3 ]; then printf '%s\n' "$3"; fi
  } >"$1"
}

entry "$USER_APPS/org.example.Mail.desktop" Mail
entry "$USER_APPS/vendor/tool.desktop" "Vendor Tool"          # bundle identifier vendor-tool
entry "$SHARED_APPS/org.example.Maps.desktop" Maps
entry "$SHARED_APPS/org.example.Notes.desktop" Notes "Implements=vireon.Intents;"
entry "$SHARED_APPS/org.example.Clock.desktop" Clock
entry "$USER_APPS/org.example.Clock.desktop" Clock "Hidden=true"  # the user's copy hides the shared one
entry "$SHARED_APPS/org.example.Terminal.desktop" Terminal        # installed, not whitelisted

python3 - "$ROOT/share/vireond/app-whitelist.json" <<'PY'
import json, sys
ids = {"org.example.Mail": 0, "vendor-tool": 9, "org.example.Maps": 3, "org.example.Notes": 17,
       "org.example.Clock": 21, "org.example.Music": 30}
inner = {"version": "0a1F", "apps": {bundle: [{"encoding_id": i}] for bundle, i in ids.items()}}
with open(sys.argv[1], "w") as f:
    json.dump({"compression": "RLE", "encoding": "bitmap", "apps": json.dumps(inner)}, f)
PY
echo "   7 desktop entries, whitelist resource $ROOT/share/vireond/app-whitelist.json"
echo "   expected whitelisted ids: 0 (Mail), 3 (Maps), 9 (vendor-tool), 17 (Notes)"
