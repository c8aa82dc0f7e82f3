#!/usr/bin/env bash
# The main job: build everything, boot an emulated phone whose daemon records
# from boot into /data, move that run and its held logs onto the card with a
# client's "copy", and show what was written.
set -eu
cd "$(dirname "$0")/.."
tools/install-deps.sh
cmake -S . -B build -G Ninja >/dev/null
cmake --build build

phone=${TAVLO_DEMO_IMAGE:-$PWD/phone-demo}
emu=tools/tavlo-emu
$emu stop "$phone" >/dev/null 2>&1 || true
trap '$emu stop "$phone" >/dev/null 2>&1 || true' EXIT
# A fresh phone whose system defaults turn recording at boot on.
rm -rf "$phone"
mkdir -p "$phone/system/etc"
echo "com.quorvex.log.tavlo.enabled=true" > "$phone/system/etc/qrvlog-config.prop"

echo "== Booting the emulated phone in $phone (recording from boot)"
$emu boot "$phone"
for i in 1 2 3; do
    echo "<6>[demo] boot-time kernel line $i" > "$phone/.emu/kmsg"
done
sleep 2
$emu exec "$phone" tavlologctl status
echo
echo "== Held in /data while the card is not used yet: /data/log_temp/"
ls -l "$phone/data/log_temp"
echo "-- kernel_log"
cat "$phone/data/log_temp/kernel_log"

echo
echo "== A client asks for the copy to the card"
$emu exec "$phone" tavlologctl copy
echo "<6>[demo] kernel line after the copy" > "$phone/.emu/kmsg"
# The reply comes first; the held logs and the device's state follow.
for _ in $(seq 100); do
    grep -qs "<< system properties >>" "$phone"/sdcard/qrvlog/tavlolog/APLog_*/properties && break
    sleep 0.1
done
sleep 1
run=$(ls -d "$phone"/sdcard/qrvlog/tavlolog/APLog_* | tail -n 1)
echo
echo "== The run folder on the card: $run"
ls -l "$run"
echo "-- kernel_log.boot (what was held, after its note line)"
cat "$run/kernel_log.boot"
echo "-- kernel_log (the run goes on here)"
cat "$run/kernel_log"
echo "-- properties (section headers)"
grep '^<< ' "$run/properties"
echo
echo "== /data/log_temp/ after the copy"
ls -d "$phone/data/log_temp" 2>/dev/null || echo "(gone)"
echo "== Folder records: /data/misc/tqlog/inter_sd_folder"
cat "$phone/data/misc/tqlog/inter_sd_folder"

$emu exec "$phone" tavlologctl stop
echo
echo "== Central history: $phone/data/misc/tqlog/tqlog_history"
cat "$phone/data/misc/tqlog/tqlog_history"
