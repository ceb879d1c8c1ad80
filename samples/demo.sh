#!/usr/bin/env bash
# Shows the whole system at work on a scratch platform: samples/demo.sh BUILD-DIRECTORY
# Every step prints what was asked and what came back, and checks it. Ends non-zero when an answer is not the right one.
set -euo pipefail
export LC_ALL=C

if [[ $# -ne 1 || ! -x $1/bin/zbd ]]; then
    echo "usage: samples/demo.sh BUILD-DIRECTORY" >&2
    exit 2
fi
build=$(cd "$1" && pwd)
here=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
zbctl=$build/bin/zbctl
manager=com.nordane.private.zembra.manager
auto_elect=com.nordane.developer.auto-elect-plugin
deadline=60 # seconds; reached only when something is wrong

if [[ -t 1 ]]; then bold=$'\e[1m' green=$'\e[32m' red=$'\e[31m' plain=$'\e[0m'; else bold='' green='' red='' plain=''; fi

work='' daemon='' failures=0
cleanup() {
    if [[ -n $daemon ]]; then kill -KILL "$daemon" 2>/dev/null || true; fi
    if [[ -n $work ]]; then rm -rf "$work"; fi
}
trap cleanup EXIT

# Entitlements are extended attributes, which not every file system keeps.
for place in "${TMPDIR:-/tmp}" "$build"; do
    work=$(mktemp -d "$place/zbd-demo.XXXXXX")
    cp "$zbctl" "$work/zbctl"
    if reason=$("$zbctl" sign "$work/zbctl" -e "$manager" 2>&1); then break; fi
    rm -rf "$work"
    work=''
done
if [[ -z $work ]]; then
    echo "demo: programs cannot be signed here: $reason" >&2
    exit 1
fi
work=$(cd "$work" && pwd -P)
signed_zbctl=$work/zbctl
root=$work/root
log=$work/zbd.log
export NORDANE_ROOT=$root
applications=$root/Applications
word_count=$applications/Editor.app/PlugIns/WordCount.appex
phrases=$applications/Editor.app/PlugIns/Phrases.appex
turn=$applications/Gallery.app/PlugIns/Turn.appex
misfit=$applications/Broken.app/PlugIns/Misfit.appex
checksum=$root/System/Library/PlugIns/Checksum.plugin
outline=$root/aside/Outline.app/PlugIns/Outline.appex
stamp=$applications/Stamp.app/PlugIns/Stamp.appex
host=$applications/Host.app/Host

# --- showing and checking ---

step() { printf '\n%s%s%s\n' "$bold" "$1" "$plain"; }

shorten() { sed -e "s|$work/root|ROOT|g" -e "s|$build/bin/||g" -e "s|$work|WORK|g"; }

show() { shorten | cut -c -160 | sed -e 's/^/    /'; }

# Runs a command; leaves its output in $work/out and $work/err and its status in $status.
ask() {
    printf '  $ %s\n' "$(printf '%s ' "$@" | shorten)"
    status=0
    "$@" >"$work/out" 2>"$work/err" </dev/null || status=$?
    { head -n 16 "$work/out" | show; } || true
    if (($(wc -l <"$work/out") > 16)); then echo '    ...'; fi
    show <"$work/err"
}

verdict() { # RIGHT? WHAT
    if [[ $1 == yes ]]; then
        printf '  %s✓%s %s\n' "$green" "$plain" "$2"
    else
        printf '  %s✗ %s%s\n' "$red" "$2" "$plain"
        failures=$((failures + 1))
    fi
}

check_status() { # NUMBER
    if [[ $status -eq $1 ]]; then verdict yes "exit status $1"; else verdict no "exit status $status instead of $1"; fi
}

check_text() { # FILE TEXT
    if grep -q -F -e "$2" "$work/$1"; then verdict yes "$(shorten <<<"$2")"; else verdict no "missing: $2"; fi
}

# The value under a path of keys ("bundleInfo/VBBundleName") in the form of the last "find".
field() {
    python3 -c '
import json, sys
value = json.load(open(sys.argv[1]))
for key in sys.argv[2].split("/"):
    value = value.get(key, {})
print(value if isinstance(value, str) else json.dumps(value, ensure_ascii=False))' "$work/form" "$1"
}

# Finds a plug-in as a script does; `ask` shows the same to people.
find_form() {
    ask "$zbctl" find "$@"
    check_status 0
    "$zbctl" --json find "$@" >"$work/form" || verdict no "zbctl --json find"
}

check_field() { # KEYS VALUE
    local value
    value=$(field "$1") || value='(no form)'
    if [[ $value == "$2" ]]; then verdict yes "$1 is $(shorten <<<"$2")"; else verdict no "$1 is $value instead of $2"; fi
}

check_not_found() { # zbctl find ARGUMENTS
    ask "$zbctl" find "$@"
    check_status 1
    check_text err 'error 15: Cannot locate PlugIn'
}

# Waits until the daemon's log holds a line of this pattern, and shows it.
check_log() { # PATTERN
    local lines reader line
    exec {lines}< <(exec tail -n +1 -f "$log")
    reader=$!
    if line=$(timeout "$deadline" grep -E -m 1 -e "$1" <&"$lines"); then
        printf '    log: %s\n' "$(shorten <<<"$line" | cut -c -220)"
        verdict yes "the log tells it"
    else
        verdict no "the log never showed: $1"
    fi
    exec {lines}<&-
    kill "$reader" 2>/dev/null || true
}

set_languages() {
    local strings
    strings=$(printf '<string>%s</string>' "$@")
    printf '<vlist version="1.0"><dict><key>languages</key><array>%s</array></dict></vlist>\n' "$strings" \
        >"$root/var/db/Locale.new"
    mv "$root/var/db/Locale.new" "$root/var/db/Locale.vlist"
}

# --- the steps ---

step "A scratch platform: three sample applications, a host, a system plug-in"
"$here/layout.sh" "$build" "$root"
echo "  ROOT is $root"
(cd "$root" && find Applications System aside -name '*.app' -o -name '*.appex' -o -name '*.plugin') | LC_ALL=C sort | sed 's/^/    /'
ask "$zbctl" sign "$word_count/WordCount" -e "$auto_elect"
check_status 0
ask "$zbctl" sign "$word_count/WordCount" --show
check_text out "$auto_elect"

step "The daemon starts"
NORDANE_LOG=debug,private,stderr "$build/bin/zbd" 2>"$log" </dev/null &
daemon=$!
until
    status=0
    "$zbctl" bulk 2>/dev/null || status=$?
    [[ $status -ne 3 ]]
do
    if ! kill -0 "$daemon" 2>/dev/null || ((SECONDS > deadline)); then
        show <"$log"
        verdict no "zbd answers"
        exit 1
    fi
done
ask "$zbctl" bulk --flags 5
check_status 0
check_log 'zbd is launching'
check_log 'bulk options 0x5 not supported'

step "A plug-in found by its location, then by the UUID that came back"
find_form "$word_count"
check_field identifier org.example.editor.word-count
check_field path "$word_count"
check_field containingPath "$applications/Editor.app"
check_field localizedContainingDisplayName Editor
check_field annotations/election 1
uuid=$(field uuid)
find_form --uuid "$uuid"
check_field path "$word_count"
find_form --url "file://$word_count"
check_field uuid "$uuid"
check_not_found --uuid 00000000-0000-4000-8000-000000000000
check_not_found "$root/nowhere"

step "The same from a host program, which also reads through its token"
ask "$host" "$uuid" Info.vlist
check_status 0
check_text out 'name    Word Count'
check_text out "uuid    $uuid"
check_text out "path    $word_count"
check_text out 'tokens  1 to read files, 1 to look up its service'
check_text out '<string>org.example.editor.word-count</string>'

step "The second plug-in of that application is data only"
ask "$host" "$phrases" phrases.txt
check_status 0
check_text out 'code    none, data only'
check_text out 'tokens  1 to read files, 0 to look up its service'
check_text out 'With kind regards'

step "The plug-in on the system volume"
find_form "$checksum"
check_field systemResident true
check_field identifier org.example.system.checksum
check_field containingPath '{}'
token=$(field 'extensions' | grep -c 'Resources/methods.txt') || token=0
if [[ $token -eq 1 ]]; then verdict yes "a token for its shared file"; else verdict no "no token for its shared file"; fi

step "Localized names and actions, in English and then in German"
find_form "$turn"
check_field localizedDisplayName 'Turn Pictures'
check_field bundleInfo/VBBundleDisplayName 'Turn Pictures'
check_field localizedFilevaneActionNames '{"TurnLeft": "Turn Left", "TurnRight": "Turn Right"}'
set_languages de en
check_log 'locale change detected; purging cache'
check_log 'purging cache for [0-9]+ > 0'
find_form "$turn"
check_field localizedDisplayName 'Bilder drehen'
check_field localizedShortName 'Drehen'
check_field localizedContainingDisplayName 'Galerie'
check_field localizedFilevaneActionNames '{"TurnLeft": "Nach links drehen", "TurnRight": "Nach rechts drehen"}'

step "A mis-configured plug-in is refused, with its reason"
check_not_found "$misfit"
check_log 'ignoring mis-configured plug-in at .*Misfit\.appex: Application Extensions may not use the "PrincipalClass" key'

step "A plug-in outside the applications directory, added by hand"
check_not_found "$outline"
ask "$zbctl" add "$outline"
check_status 0
check_log 'plug-in INSTALLED:org\.example\.outline\.outline'
find_form "$outline"
check_field identifier org.example.outline.outline
ask "$zbctl" add "$root/nowhere"
check_status 1
check_text err "error 9: invalid plugin path: $root/nowhere"

step "Removing it needs an entitlement"
ask "$zbctl" remove "$outline"
check_status 1
check_text err 'error 11: caller lacks entitlement for this operation'
check_log 'refused request from pid=[0-9]+ to remove plug-in at .*Outline\.appex - client lacks required entitlement'
find_form "$outline"
ask "$zbctl" sign "$signed_zbctl" --show
check_text out "$manager"
ask "$signed_zbctl" remove "$outline"
check_status 0
check_log 'plug-in UNINSTALLED:org\.example\.outline\.outline'
check_not_found "$outline"

step "An application copied in while the daemon runs, and deleted"
echo '  $ cp -R ROOT/aside/Stamp.app ROOT/Applications/'
cp -R "$root/aside/Stamp.app" "$applications/"
check_log 'plug-in INSTALLED:org\.example\.stamp\.stamp'
find_form "$stamp"
check_field identifier org.example.stamp.stamp
echo '  $ rm -r ROOT/Applications/Stamp.app'
rm -r "$applications/Stamp.app"
check_log 'plug-in UNINSTALLED:org\.example\.stamp\.stamp'
check_not_found "$stamp"

step "SIGTERM: the daemon tells those who watch, and ends"
echo '  $ zbctl watch --count 1 &'
exec {watching}< <(exec "$zbctl" watch --count 1 2>&1)
watcher=$!
if read -r -t "$deadline" -u "$watching" line; then show <<<"$line"; fi
echo '  $ kill -TERM zbd'
kill -TERM "$daemon"
if read -r -t "$deadline" -u "$watching" line && [[ $line == com.nordane.zembra.annotation-change ]]; then
    show <<<"$line"
    verdict yes "the notification came"
else
    verdict no "no notification"
    kill "$watcher" 2>/dev/null || true
fi
status=0
wait "$daemon" || status=$?
daemon=''
check_status 0
ask "$zbctl" bulk
check_status 3

step "What stays: the annotation file"
show <"$root/var/db/Zembra-Annotations" || true
cp "$root/var/db/Zembra-Annotations" "$work/out" || true
check_text out '<key>org.example.editor.word-count</key>'
check_text out '<integer>16</integer>'

echo
if ((failures > 0)); then
    echo "${red}$failures answers were not the right ones.${plain} The daemon's log:"
    show <"$log"
    exit 1
fi
echo "${green}All answers were the right ones.${plain}"
