#!/usr/bin/env bash
# Keeps the core portable: only the Linux layer (src/platform/linux/), the entry point
# that wires it up (src/daemon/main.cc) and the base runtime files listed below may
# include operating-system or system-library headers. Everything else in src/ sees the
# platform through src/platform/*.h, base/ and the C++ standard library.
#
# Refused in the core:
#   kernel and POSIX headers: <linux/...> <asm/...> <sys/...> <netinet/...> <arpa/...>
#     <net/...> and the POSIX C headers below (unistd.h, fcntl.h, dirent.h, ...);
#   system libraries: <openssl/...> <libmount/...> <libmount.h> <libudev.h>
#     <blkid/...> <blkid.h>.
# Allowed: the C++ standard library, including the C headers it wraps (<cerrno>,
# <cstring>, <csignal> ...), which exist on every platform; and expat, which base/
# uses to read XML property lists on every platform.
#
# Tests, benchmarks and fuzz targets are not checked: the Linux layer's own tests need
# these headers, and the core's tests link fakes rather than reach the system.
set -euo pipefail
cd "${1:-$(dirname "$0")/..}"

posix='unistd|fcntl|dirent|fts|ftw|mntent|poll|spawn|termios|syslog|dlfcn|pwd|grp|sched|signal|pthread|semaphore|mqueue|aio|glob|utmp|ifaddrs|netdb|resolv|err|error|libudev|libmount|blkid'
pattern="^[[:space:]]*#[[:space:]]*include[[:space:]]*<((linux|asm|asm-generic|sys|netinet|arpa|net|openssl|libmount|blkid)/[^>]*|(${posix})\\.h)>"

# The base runtime's own implementation files: the epoll main loop, the log sink and
# the descriptor owner are the process's plumbing and need the system to exist. Their
# headers stay clean, which this script checks like any other file.
allowed='^src/(platform/linux/|daemon/main\.cc$|base/(runloop|log|unique_fd)\.cc$)'

violations=$(git ls-files --cached --others --exclude-standard -- src | grep -E '\.(cc|h|inc|in)$' | grep -v -E "$allowed" |
             xargs -r grep -n -E "$pattern" || true)
if [[ -n "$violations" ]]; then
  echo "System headers included outside src/platform/linux/ (reach the system through src/platform/*.h):" >&2
  echo "$violations" >&2
  exit 1
fi
echo "Include boundary: OK"
