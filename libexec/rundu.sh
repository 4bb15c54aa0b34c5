#!/bin/sh
# rundu.sh MOUNT FILE: writes the disk usage of the files and directories of the file system
# mounted at MOUNT (in kilobytes, largest first, at most MAX_LINES lines, as "SIZE<tab>PATH") into
# FILE in the monitor's data directory, and says on standard output what it wrote.
#
# It stays on that one file system (du -x). FILE is replaced whole: the listing goes into a
# temporary file beside it, which is then renamed, so a reader finds the previous listing or the
# new one and never part of one. The data directory must belong to the user running the script:
# its name comes from the caller's environment, and the script must not write where that user could
# not. Exit status: 0 written; 2 wrong arguments (nothing written); 1 the listing could not be
# written (the previous file is left as it was).
set -eu
PATH=/usr/sbin:/usr/bin:/sbin:/bin
LC_ALL=C
export PATH LC_ALL

MAX_LINES=1000

refuse() {
    printf 'rundu.sh: %s\n' "$1" >&2
    exit 2
}

[ "$#" -eq 2 ] || refuse 'usage: rundu.sh MOUNT FILE'
mount=$1
file=$2

case $mount in
/*) ;;
*) refuse "the mount point is not an absolute path: $mount" ;;
esac
[ ! -L "$mount" ] || refuse "the mount point is a symbolic link: $mount"
[ -d "$mount" ] || refuse "the mount point is not a directory: $mount"
mountpoint -q -- "$mount" || refuse "not a mount point: $mount"

# A plain name, which no listing's temporary name (".FILE.XXXXXX") can be.
case $file in
'' | .* | *[!A-Za-z0-9._-]*)
    refuse "the file is not a name of letters, digits, '.', '_' and '-' that begins with no '.': $file"
    ;;
esac

data_dir=${TELV_DATA_DIR:-/var/lib/telvzmnd}
case $data_dir in
/*) ;;
*) refuse "the data directory is not an absolute path: $data_dir" ;;
esac
# Everything from here on is relative to the directory this opened, so that no rename of a
# component of its path can turn the writes elsewhere.
cd -P -- "$data_dir" 2>/dev/null || refuse "no data directory: $data_dir"
[ -O . ] || refuse "the data directory does not belong to user $(id -u): $data_dir"

umask 077
listing=$(mktemp -- ".$file.XXXXXX")
trap 'rm -f -- "$listing"' EXIT
trap 'exit 1' HUP INT TERM

# NUL-separated until the end, so that a name with a line feed stays one entry (shown with "?").
# A file that vanishes or cannot be read while du walks is left out; the listing is a best effort.
du -0 -axk -- "$mount" 2>/dev/null | sort -z -rn | head -z -n "$MAX_LINES" | tr '\0\n' '\n?' >"$listing"
lines=$(wc -l <"$listing")
chmod 0640 -- "$listing"
mv -f -T -- "$listing" "$file"
printf 'rundu.sh: %s largest entries of %s written to %s/%s\n' "$lines" "$mount" "$data_dir" "$file"
