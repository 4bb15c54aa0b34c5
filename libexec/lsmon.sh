#!/bin/sh
# lsmon.sh: the long listing of every process's descriptor directory, as the monitor's open files
# check reads it. For each /proc/<pid>/fd: a header line "/proc/<pid>/fd:", "total 0", one line per
# descriptor, and a blank line between directories. The check counts the lines of each block and
# subtracts 5 for its summary, so this layout is kept exactly; -q keeps a descriptor whose target
# has a line feed in its name on one line (shown with "?").
#
# Only the numeric entries of /proc are listed: /proc/self and /proc/thread-self would list this
# listing's own process under a name that is no pid. A process that ends, or a directory that
# cannot be read, costs only an error message of ls, which is dropped: the exit status is 0.
set -eu
PATH=/usr/sbin:/usr/bin:/sbin:/bin
LC_ALL=C
export PATH LC_ALL

if [ "$#" -ne 0 ]; then
    printf 'lsmon.sh: usage: lsmon.sh (no arguments)\n' >&2
    exit 2
fi
ls -Rlq -- /proc/[0-9]*/fd 2>/dev/null || true
