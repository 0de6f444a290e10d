#!/bin/sh
# Reports how a machine is doing, for machines that have no status report of their own.
#
#   gen_healthsheet.sh
#
# A debug archive holds what this prints as healthsheet.txt. Nothing but busybox is needed; a source
# that a machine does not have costs its own section, and the exit status is 0 all the same.

# This is run with an empty environment.
PATH=/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin
export PATH
LC_ALL=C
export LC_ALL

PROCESSES=15  # those with the most memory
MESSAGES=40   # of the kernel, the last ones

section() {
    printf '\n== %s\n' "$1"
}

# Passes its input on, or says that there was none.
or_none() {
    awk '{ print } END { if (NR == 0) print "(not available)" }'
}

up_time() {
    awk '{
        minutes = int($1 / 60)
        printf "up %d days %d:%02d\n", minutes / 1440, minutes % 1440 / 60, minutes % 60
    }' /proc/uptime
    awk '{ print "load " $1 " " $2 " " $3 ", processes " $4 }' /proc/loadavg
}

memory() {
    grep -E '^(MemTotal|MemFree|MemAvailable|Buffers|Cached|Slab|SwapTotal|SwapFree):' /proc/meminfo
}

# Only local file systems: asking a server that has gone would keep the report waiting.
# Some builds of busybox run their own df for a bare name, whatever is in PATH.
disks() {
    awk '$1 !~ /:/ && $1 !~ /^\/\// && $3 !~ /^(nfs|cifs|smb|autofs|fuse($|\.))/ {
        gsub(/\\040/, " ", $2)  # as the kernel writes a blank
        print $2
    }' /proc/mounts | sort -u | tr '\n' '\0' | xargs -0 -r "$(command -v df)" -k |
        awk 'NR == 1 || $2 != 0'
}

interfaces() {
    if command -v ip >/dev/null; then
        ip addr
    else
        ifconfig -a
    fi
    awk 'NR > 2 {
        sub(/:/, " ")
        printf "%s: received %s bytes, %s errors; sent %s bytes, %s errors\n", $1, $2, $4, $10, $12
    }' /proc/net/dev
}

# By way of cat, which goes on when a process has ended meanwhile.
processes() {
    cat /proc/[0-9]*/status | awk '
        $1 == "Name:" { name = $2 }
        $1 == "State:" { state = $2 }
        $1 == "Pid:" { pid = $2 }
        $1 == "VmSize:" { size = $2 }
        $1 == "VmRSS:" { printf "%8d %s %10d %10d %s\n", pid, state, $2, size, name }
    ' | sort -k 3,3nr -k 1,1n | head -n "$PROCESSES" |
        sed '1i\
     PID S     RSS kB    SIZE kB NAME'
}

messages() {
    dmesg | tail -n "$MESSAGES"
}

echo "status report of $(date '+%Y-%m-%d %H:%M:%S')"
uname -a
for part in up_time memory disks interfaces processes messages; do
    section "$(echo "$part" | tr _ ' ')"
    $part 2>/dev/null | or_none
done
exit 0
