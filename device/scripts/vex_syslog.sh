#!/bin/sh
# (Re)starts the local system log.
#
#   vex_syslog.sh -L -o PATH -l LEVEL -s SIZE
#
# PATH is the log file or the folder for it, LEVEL 1 to 8, SIZE in KB; a value that is missing leaves syslogd's own.
path= level= size=
while [ $# -gt 0 ]; do
    # An empty value leaves its option in front of the next one.
    case $1 in
        -o | -l | -s)
            case ${2:-} in
                '' | -*) ;;
                *)
                    case $1 in -o) path=$2 ;; -l) level=$2 ;; -s) size=$2 ;; esac
                    shift
                    ;;
            esac
            ;;
    esac
    shift
done

[ -d "${path:-/logfs}" ] && path=${path:-/logfs}/syslog
killall -q syslogd
syslogd -O "$path" ${level:+-l "$level"} ${size:+-s "$size"} >/dev/null 2>&1 &
exit 0
