// The commands of a host with nothing to report, for tests that run whole passes: free, cat of
// /proc/meminfo and of file-nr (any other file is the real cat's), and both df, each far below
// every threshold of the quiet and the example control files.
#pragma once

#include <string>

#include "fake_commands.h"

namespace quiet_host {

inline const std::string FREE =
    "               total        used        free      shared  buff/cache   available\n"
    "Mem:         1000000      200000      600000        1000      200000      700000\n"
    "Swap:              0           0           0\n";
inline const std::string MEMINFO = "MemTotal:        1000000 kB\nMemFree:          600000 kB\n";
inline const std::string FILE_NR = "1000\t0\t100000\n";
inline const std::string DF_SPACE = "Filesystem     Type      Size  Used Avail Use% Mounted on\n"
                                    "/dev/vda1      ext4       20G    2G   18G  10% /\n";
inline const std::string DF_INODES = "Filesystem      Inodes  IUsed   IFree IUse% Mounted on\n"
                                     "/dev/vda1      1310720 131072 1179648   10% /\n";

// Puts them among `fakes`, with a ps that prints `ps`.
inline void add_commands(fake::fake_commands &fakes, const std::string &ps) {
    fakes.add_printing("ps", ps);
    fakes.add_printing("free", FREE);
    fakes.add("cat", "#!/bin/sh\ncase \"$1\" in\n/proc/meminfo) printf '%s' '" + MEMINFO +
                         "' ;;\n/proc/sys/fs/file-nr) printf '%s' '" + FILE_NR +
                         "' ;;\n*) exec /bin/cat \"$@\" ;;\nesac\n");
    fakes.add("df", "#!/bin/sh\nif [ \"$1\" = -h ]; then printf '%s' '" + DF_SPACE +
                        "'; else printf '%s' '" + DF_INODES + "'; fi\n");
}

} // namespace quiet_host
