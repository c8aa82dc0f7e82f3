#!/usr/bin/env bash
# The main job: build everything, boot an emulated phone with the daemon,
# record a logging run of its logs (Android logger buffers, kernel log,
# Bluetooth stack log), and show what was written.
set -eu
cd "$(dirname "$0")/.."
tools/install-deps.sh
cmake -S . -B build -G Ninja >/dev/null
cmake --build build

phone=${TAVLO_DEMO_IMAGE:-$PWD/phone-demo}
emu=tools/tavlo-emu
$emu stop "$phone" >/dev/null 2>&1 || true
trap '$emu stop "$phone" >/dev/null 2>&1 || true' EXIT

echo "== Booting the emulated phone in $phone"
$emu boot "$phone"

echo "== Starting a logging run"
$emu exec "$phone" tavlologctl start
echo "== Writing logs on the phone"
$emu exec "$phone" log -t demo hello
$emu exec "$phone" log -b system -p w -t demo_sys "a line on the system buffer"
$emu exec "$phone" log -b radio -t demo_radio "a line on the radio buffer"
$emu exec "$phone" log -b events -t 1000003 i:3 s:demo
for i in 1 2 3 4 5; do
    echo "<6>[demo] kernel line $i from the host" > "$phone/.emu/kmsg"
done
printf 'bluetooth stack log line from the host\n' > "$phone/.emu/btlog"
sleep 2
$emu exec "$phone" tavlologctl status
echo "== Stopping the run"
$emu exec "$phone" tavlologctl stop

echo
echo "== Central history: $phone/data/misc/tqlog/tqlog_history"
cat "$phone/data/misc/tqlog/tqlog_history"
echo
echo "== Configuration: $phone/data/misc/tqlog/tqlog_config"
cat "$phone/data/misc/tqlog/tqlog_config"
run=$(ls -d "$phone"/sdcard/qrvlog/tavlolog/APLog_* 2>/dev/null | tail -n 1 || true)
if [ -n "$run" ]; then
    echo
    echo "== The run folder: $run"
    ls -l "$run"
    for name in main_log radio_log events_log kernel_log bt_log; do
        echo
        echo "== $run/$name"
        cat "$run/$name"
    done
fi
