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
export PATH=$build/bin:$PATH # hosts launch plug-ins with zbignite
manager=com.nordane.private.zembra.manager
auto_elect=com.nordane.developer.auto-elect-plugin
replace_plugin=com.nordane.developer.replace-plugin
provide_environment=com.nordane.developer.zembra.provide-environment
allowed_plugins=com.nordane.developer.zembra.allowedplugins
preferences=com.nordane.zembra.userprefs
deadline=60 # seconds; reached only when something is wrong

if [[ -t 1 ]]; then bold=$'\e[1m' green=$'\e[32m' red=$'\e[31m' plain=$'\e[0m'; else bold='' green='' red='' plain=''; fi

work='' daemon='' failures=0 helpers=()
cleanup() {
    for process in "${helpers[@]}" $daemon; do kill -KILL "$process" 2>/dev/null || true; done
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
next_word_count=$applications/NextEditor.app/PlugIns/WordCount.appex
statistics=$applications/Statistics.app/PlugIns/Statistics.appex
probe=$applications/Lab.app/PlugIns/Probe.appex
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

# What the last "match" or the next one would answer, for scripts: identifier and version of each, sorted.
matches() { # zbctl match ARGUMENTS
    "${client:-$zbctl}" --json match "$@" | python3 -c '
import json, sys
print(", ".join(sorted(form["identifier"] + " " + form["version"] for form in json.load(sys.stdin))))'
}

check_match() { # EXPECTED zbctl match ARGUMENTS
    local expected=$1 got
    shift
    ask "${client:-$zbctl}" match "$@"
    check_status 0
    got=$(matches "$@") || got='(no answer)'
    if [[ $got == "$expected" ]]; then
        verdict yes "offered: ${expected:-nothing}"
    else
        verdict no "offered: $got instead of $expected"
    fi
}

# Waits until a file that somebody writes holds a line of this pattern, and leaves it in $line.
wait_for_line() { # FILE PATTERN
    local lines reader found=0
    exec {lines}< <(exec tail -n +1 -f "$1")
    reader=$!
    line=$(timeout "$deadline" grep -E -m 1 -e "$2" <&"$lines") || found=1
    exec {lines}<&-
    kill "$reader" 2>/dev/null || true
    return $found
}

check_log() { # PATTERN
    if wait_for_line "$log" "$1"; then
        printf '    log: %s\n' "$(shorten <<<"$line" | cut -c -220)"
        verdict yes "the log tells it"
    else
        verdict no "the log never showed: $1"
    fi
}

# Starts a command that runs on beside the steps, and waits for its first line of output, which it leaves in $line.
# Its standard input stays open until `end_input`.
background() { # PATTERN COMMAND...
    local pattern=$1
    shift
    printf '  $ %s &\n' "$(printf '%s ' "$@" | shorten)"
    rm -f "$work/input"
    mkfifo "$work/input"
    : >"$work/output"
    "$@" <"$work/input" >"$work/output" 2>&1 &
    helper=$!
    helpers+=("$helper")
    exec {input}>"$work/input"
    if wait_for_line "$work/output" "$pattern"; then show <"$work/output"; else verdict no "it never printed: $pattern"; fi
}

end_input() { exec {input}>&-; }

check_end() { # STATUS
    status=0
    wait "$helper" 2>/dev/null || status=$? # the shell would comment on a killed one
    helpers=()
    check_status "$1"
}

# Runs what causes a notification while another process watches for it.
check_notified() { # FUNCTION ARGUMENT...
    local watching watcher line
    echo '  $ zbctl watch --count 1 &'
    exec {watching}< <(exec "$zbctl" watch --count 1 2>&1)
    watcher=$!
    if read -r -t "$deadline" -u "$watching" line; then show <<<"$line"; fi
    "$@"
    if read -r -t "$deadline" -u "$watching" line && [[ $line == com.nordane.zembra.annotation-change ]]; then
        show <<<"$line"
        verdict yes "the notification came"
    else
        verdict no "no notification"
        kill "$watcher" 2>/dev/null || true
    fi
    exec {watching}<&-
}

set_languages() {
    local strings
    strings=$(printf '<string>%s</string>' "$@")
    printf '<vlist version="1.0"><dict><key>languages</key><array>%s</array></dict></vlist>\n' "$strings" \
        >"$root/var/db/Locale.new"
    mv "$root/var/db/Locale.new" "$root/var/db/Locale.vlist"
}

move_in() { # APPLICATION
    printf '  $ mv ROOT/aside/%s ROOT/Applications/\n' "$1"
    mv "$root/aside/$1" "$applications/"
}

# --- the acts of the story ---

show_platform() {
    step "A scratch platform: sample applications, a host, a system plug-in"
    "$here/layout.sh" "$build" "$root"
    echo "  ROOT is $root"
    (cd "$root" && find Applications System aside -name '*.app' -o -name '*.appex' -o -name '*.plugin') | LC_ALL=C sort | sed 's/^/    /'
    ask "$zbctl" sign "$word_count/WordCount" -e "$auto_elect"
    check_status 0
    ask "$zbctl" sign "$word_count/WordCount" --show
    check_text out "$auto_elect"
}

show_start() {
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
}

show_find() {
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
}

show_host() {
    step "The same from a host program, which also reads through its token"
    ask "$host" show "$uuid" Info.vlist
    check_status 0
    check_text out 'name    Word Count'
    check_text out "uuid    $uuid"
    check_text out "path    $word_count"
    check_text out 'tokens  1 to read files, 1 to look up its service'
    check_text out '<string>org.example.editor.word-count</string>'
}

show_data() {
    step "The second plug-in of that application is data only"
    ask "$host" show "$phrases" phrases.txt
    check_status 0
    check_text out 'code    none, data only'
    check_text out 'tokens  1 to read files, 0 to look up its service'
    check_text out 'With kind regards'
}

show_system() {
    step "The plug-in on the system volume"
    find_form "$checksum"
    check_field systemResident true
    check_field identifier org.example.system.checksum
    check_field containingPath '{}'
    token=$(field 'extensions' | grep -c 'Resources/methods.txt') || token=0
    if [[ $token -eq 1 ]]; then verdict yes "a token for its shared file"; else verdict no "no token for its shared file"; fi
}

show_languages() {
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
}

show_misfit() {
    step "A mis-configured plug-in is refused, with its reason"
    check_not_found "$misfit"
    check_log 'ignoring mis-configured plug-in at .*Misfit\.appex: Application Extensions may not use the "PrincipalClass" key'
}

show_misfit_inspected() {
    step "What is wrong with a bundle is seen without the daemon too"
    ask "$zbctl" inspect "$misfit"
    check_status 1
    check_text out 'Application Extensions may not use the "PrincipalClass" key'
    ask "$zbctl" inspect "$word_count"
    check_status 0
}

show_add() {
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
}

show_remove() {
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
}

show_install() {
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
}

show_discovery() {
    step "A host discovers by extension point; rules narrow it down"
    ask "$host" discover org.example.text-service
    check_status 0
    check_text out 'Word Count 2.1, chosen by the user'
    check_match 'org.example.gallery.turn 1.4' -r VKExtensionPointName=org.example.picture-service
    check_match 'org.example.editor.word-count 2.1' -r 'VKExtensionVersion=>=2' -r Languages=fr -r Languages=de
    check_match '' -r 'VKExtensionVersion=>2.10'
    check_match 'org.example.system.checksum 1.0' --system-only
    ask "$zbctl" match --all
    check_status 1
    check_text err 'error 11: unauthorized discovery flag (ZBDiscoverAll)'
    client=$signed_zbctl check_match 'org.example.editor.word-count 2.1' --all -r ReadsText
}

put_aside() {
    ask "$zbctl" annotate --election 2 "$word_count"
    check_status 0
}

show_election() {
    step "The user puts a plug-in aside, and takes it up again"
    check_notified put_aside
    ask "$host" discover org.example.text-service
    check_status 0
    if [[ -s $work/out ]]; then verdict no "the host sees it"; else verdict yes "the host does not see it"; fi
    check_match 'org.example.editor.word-count 2.1' -r VKUserElection=2
    ask "$zbctl" elect "$word_count"
    check_status 0
    ask "$host" discover org.example.text-service
    check_text out 'chosen by the user'
    printf '{"%s": {"color": "blue"}}\n' "$uuid" >"$work/settings.json"
    ask "$zbctl" bulk-annotate "$work/settings.json"
    check_status 0
    find_form "$word_count"
    check_field annotations/extension '{"color": "blue"}'
    check_field annotations/election 1
}

show_exclusion() {
    step "The user excludes a plug-in from every host"
    local file
    file=$root/var/db/users/$(id -u)/Preferences/$preferences.$(uname -n).vlist
    (umask 077 && mkdir -p "$(dirname "$file")")
    printf '<vlist><dict><key>exclusions</key><array><dict><key>VKExtensionIdentifier</key><string>%s</string></dict></array></dict></vlist>' \
        org.example.gallery.turn >"$file"
    echo "  exclusions in the preferences $preferences: VKExtensionIdentifier = org.example.gallery.turn"
    check_match '' -r VKExtensionPointName=org.example.picture-service
    check_log 'client [0-9]+ plugin .* globally excluded'
    rm "$file"
    check_match 'org.example.gallery.turn 1.4' -r VKExtensionPointName=org.example.picture-service
}

show_update() {
    step "Another application brings a newer version of the plug-in: it wins"
    move_in NextEditor.app
    check_log 'plug-in INSTALLED:org\.example\.editor\.word-count'
    check_match 'org.example.editor.word-count 2.10' -r VKExtensionPointName=org.example.text-service
    check_match 'org.example.editor.word-count 2.1, org.example.editor.word-count 2.10' --all-versions \
        -r VKExtensionPointName=org.example.text-service
    find_form "$next_word_count"
    check_field annotations/election 1
}

show_replacement() {
    step "A plug-in that replaces another one is marked, and so is the other"
    ask "$zbctl" sign "$root/aside/Statistics.app/PlugIns/Statistics.appex/Statistics" \
        -e "$replace_plugin=org.example.editor.word-count"
    check_status 0
    move_in Statistics.app
    check_log 'plug-in INSTALLED:org\.example\.statistics\.text'
    check_match 'org.example.editor.word-count 2.10, org.example.statistics.text 1.0' \
        -r VKExtensionPointName=org.example.text-service
    check_text out '(replaces org.example.editor.word-count)'
    check_text out '(replaced by '
    ask "$host" discover org.example.text-service
    check_text out 'Word Count 2.10, chosen by the user, replaced'
    find_form "$statistics"
    check_field annotations/election 1 # the same user's decision
}

take_hold() {
    background '^[0-9A-F-]+$' "$zbctl" hold "$applications/Lab.app"
    token=$line
}

show_hold() {
    step "A hold takes an application's plug-ins away; releasing it gives them back"
    check_match 'org.example.lab.probe 1.0' -r VKExtensionPointName=org.example.experiment
    check_notified take_hold
    check_match '' -r VKExtensionPointName=org.example.experiment
    client=$signed_zbctl check_match 'org.example.lab.probe 1.0' --all -r VKExtensionPointName=org.example.experiment
    ask "$zbctl" ready "$probe"
    check_status 1
    check_text err 'error 11: access to plugin org.example.lab.probe denied: the plug-in is on hold'
    ask "$zbctl" release "$token"
    check_status 0
    check_match 'org.example.lab.probe 1.0' -r VKExtensionPointName=org.example.experiment
    kill -TERM "$helper"
    check_end 0
    end_input
    ask "$zbctl" hold "$applications/Lab.app" -- "$zbctl" match -r VKExtensionPointName=org.example.experiment
    check_status 0
    check_text out 'no plug-in matches'
}

show_lost_holder() {
    step "Who is killed holds nothing any more"
    background '^[0-9A-F-]+$' "$zbctl" hold --plug-in "$probe"
    token=$line
    kill -KILL "$helper"
    check_end 137
    check_log "releasing plug-in hold $token for dead client pid $helper"
    end_input
    check_match 'org.example.lab.probe 1.0' -r VKExtensionPointName=org.example.experiment
}

show_busy() {
    step "A busy instance refuses a hold that asks first"
    background '^busy$' "$launching_host" run "$probe"
    ask "$zbctl" hold --refuse-when-busy "$applications/Lab.app"
    check_status 1
    check_text err 'error 14: plug-ins are busy'
    check_text err 'busy: org.example.lab.probe'
    check_match 'org.example.lab.probe 1.0' -r VKExtensionPointName=org.example.experiment
    end_input
    check_end 0
    ask "$zbctl" hold --refuse-when-busy "$applications/Lab.app" -- true
    check_status 0
}

show_restriction() {
    step "A host with the restriction entitlement sees only what it may"
    cp "$host" "$work/RestrictedHost"
    printf '<vlist><dict><key>%s</key><dict><key>VKExtensionPointName</key><string>%s</string></dict></dict></vlist>' \
        "$allowed_plugins" org.example.picture-service >"$work/restriction.vlist"
    ask "$zbctl" sign "$work/RestrictedHost" --entitlements "$work/restriction.vlist"
    check_status 0
    ask "$work/RestrictedHost" discover org.example.picture-service
    check_text out 'Bilder drehen 1.4'
    ask "$work/RestrictedHost" discover org.example.text-service
    check_status 0
    if [[ -s $work/out ]]; then verdict no "it sees others"; else verdict yes "it sees no others"; fi
    check_log "client [0-9]+ cannot use plugin .*: the host's plug-in entitlement does not allow this plug-in"
    ask "$work/RestrictedHost" run "$word_count"
    check_status 1
    check_text err 'error 11: access to plugin org.example.editor.word-count denied: '
}

show_access() {
    step "Tokens open bundles: for zbctl, and for a host that opens nothing itself any more"
    ask "$zbctl" access --consume "$phrases"
    check_status 0
    check_text out phrases.txt
    ask "$host" show-confined "$phrases" phrases.txt
    check_status 0
    check_text out 'alone   cannot open it'
    check_text out 'With kind regards'
}

show_launch() {
    step "A host readies a plug-in with an environment, and launches it, confined"
    ask "$host" run "$probe" GREETING=hello
    check_status 1
    check_text err "error 11: Transmission of environment variables requires the $provide_environment host entitlement"
    launching_host=$work/LaunchingHost
    cp "$host" "$launching_host"
    ask "$zbctl" sign "$launching_host" -e "$provide_environment"
    check_status 0
    echo 'for the owner alone' >"$work/secret"
    ask "$launching_host" run "$probe" GREETING=hello LD_PRELOAD=/nowhere.so -- "$probe/Info.vlist" "$work/secret"
    check_status 0
    check_text out 'GREETING=hello'
    check_text out "HOME=$root/var/db/users/$(id -u)/Containers/org.example.lab.probe"
    check_text out "can read $probe/Info.vlist"
    check_text out "cannot read $work/secret: Permission denied"
    if grep -q LD_PRELOAD "$work/out"; then verdict no "LD_PRELOAD got through"; else verdict yes "no LD_PRELOAD"; fi
    ask zbignite org.example.lab.probe
    check_status 122
    ask "$zbctl" ready "$probe" -- zbignite org.example.lab.probe
    check_status 0
}

show_termination() {
    step "A forced hold ends the running instance, and is granted when it has ended"
    background '^HOME=' "$launching_host" run "$probe"
    ask "$zbctl" hold --terminate "$applications/Lab.app" -- true
    check_status 0
    check_log 'one or more plug-ins have been terminated for uuid='
    check_log 'forced termination complete; hold request granted'
    check_end 143
    end_input
}

show_uninstall() {
    step "Uninstalling an application ends the running instance"
    background '^HOME=' "$launching_host" run "$probe"
    echo '  $ rm -r ROOT/Applications/Lab.app'
    rm -r "$applications/Lab.app"
    check_end 143
    end_input
    check_log 'plug-in UNINSTALLED:org\.example\.lab\.probe'
    check_match '' -r VKExtensionPointName=org.example.experiment
}

stop_daemon() {
    echo '  $ kill -TERM zbd'
    kill -TERM "$daemon"
}

show_stop() {
    step "SIGTERM: the daemon tells those who watch, and ends"
    check_notified stop_daemon
    status=0
    wait "$daemon" || status=$?
    daemon=''
    check_status 0
    ask "$zbctl" bulk
    check_status 3
}

show_state() {
    step "What stays: the annotation file"
    show <"$root/var/db/Zembra-Annotations" || true
    cp "$root/var/db/Zembra-Annotations" "$work/out" || true
    check_text out '<key>org.example.editor.word-count</key>'
    check_text out '<integer>16</integer>'
}

# --- the story ---

acts=(
    platform start find host data system languages misfit misfit_inspected add remove install
    discovery election exclusion update replacement restriction hold lost_holder access launch busy termination uninstall
    stop state
)
for act in "${acts[@]}"; do "show_$act"; done

echo
if ((failures > 0)); then
    echo "${red}$failures answers were not the right ones.${plain} The daemon's log:"
    show <"$log"
    exit 1
fi
echo "${green}All answers were the right ones.${plain}"
