#!/bin/sh
# Records how the device is doing, for whoever reads its logs: vex_debug.sh get_status.
[ "${1:-}" = get_status ] || exit 1
{
    date
    uptime
    df -h
    busybox ps
    cat /proc/meminfo
} >/logfs/debug_status.txt 2>/dev/null
