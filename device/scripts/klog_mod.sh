#!/bin/sh
# Sets the log level of a kernel module: klog_mod.sh MODULE LEVEL. The simulated kernel keeps it under /run/vex/klog.
mkdir -p /run/vex/klog && printf '%s\n' "$2" >"/run/vex/klog/$1"
