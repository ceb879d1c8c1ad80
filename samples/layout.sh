#!/usr/bin/env bash
# Lays the sample applications out as a scratch platform: samples/layout.sh BUILD-DIRECTORY ROOT
# ROOT gets Applications, System and the state directories. What a demonstration adds later lies in ROOT/aside.
set -euo pipefail

if [[ $# -ne 2 ]]; then
    echo "usage: samples/layout.sh BUILD-DIRECTORY ROOT" >&2
    exit 2
fi
build=$1
root=$2
here=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)

umask 022 # what a group could write is not believed
mkdir -p "$root/var/db" "$root/run/nordane"
cp -R "$here/bundles/." "$root/"
install -D -m 644 "$here/../packaging/types.vlist" "$root/usr/share/nordane/types.d/Common.vlist"

# program  place in the bundle that its manifest names
while read -r program place; do
    install -m 755 "$build/samples/$program" "$root/$place"
done <<'PROGRAMS'
WordCount   Applications/Editor.app/PlugIns/WordCount.appex/WordCount
Turn        Applications/Gallery.app/PlugIns/Turn.appex/Turn
WordCount   Applications/Broken.app/PlugIns/Misfit.appex/Misfit
Probe       Applications/Lab.app/PlugIns/Probe.appex/Probe
sample-host Applications/Host.app/Host
Checksum    System/Library/PlugIns/Checksum.plugin/Checksum
Stamp       aside/Stamp.app/PlugIns/Stamp.appex/Stamp
Outline     aside/Outline.app/PlugIns/Outline.appex/Outline
WordCount   aside/NextEditor.app/PlugIns/WordCount.appex/WordCount
WordCount   aside/Statistics.app/PlugIns/Statistics.appex/Statistics
PROGRAMS
