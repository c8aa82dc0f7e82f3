#!/usr/bin/env bash
# The main job: build everything, boot an emulated phone whose daemon records
# its logs (Android logger buffers, kernel log, Bluetooth stack log) from boot
# into /data, move that run and its held logs onto the card with a client's
# "copy", and show what was written.
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
echo "== Writing logs on the phone while it boots"
$emu exec "$phone" log -t demo "hello from the boot"
$emu exec "$phone" log -b radio -t demo_radio "a line on the radio buffer"
$emu exec "$phone" log -b events -t 1000003 i:3 s:demo
# Kernel lines carry the time since boot, as the kernel writes them.
uptime() { awk '{printf "%12.6f", $1}' /proc/uptime; }
for i in 1 2 3; do
    echo "<6>[$(uptime)] boot-time kernel line $i" > "$phone/.emu/kmsg"
done
printf 'bluetooth stack log line from the boot\n' > "$phone/.emu/btlog"
sleep 2
$emu exec "$phone" tavlologctl status
echo
echo "== Held in /data while the card is not used yet: /data/log_temp/"
ls -l "$phone/data/log_temp"

echo
echo "== A client asks for the copy to the card"
$emu exec "$phone" tavlologctl copy
$emu exec "$phone" log -t demo "a line after the copy"
echo "<6>[$(uptime)] kernel line after the copy" > "$phone/.emu/kmsg"
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
for name in main_log radio_log events_log kernel_log bt_log; do
    echo
    echo "-- $name.boot (what was held, after its note line)"
    cat "$run/$name.boot"
    echo "-- $name (the run goes on here)"
    cat "$run/$name"
done
echo
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
echo
echo "== Configuration: $phone/data/misc/tqlog/tqlog_config"
cat "$phone/data/misc/tqlog/tqlog_config"

echo
echo "== The run as one timeline: build/tools/tavlolog/tavlolog $run"
echo "   (the held boot first; K kernel, M main and system, R radio, E events, B Bluetooth)"
build/tools/tavlolog/tavlolog --no-pager "$run"
report=$PWD/tavlolog-report.html
build/tools/tavlolog/tavlolog --html "$report" "$run" 2>/dev/null
echo
echo "== The HTML report of the run: $report"
