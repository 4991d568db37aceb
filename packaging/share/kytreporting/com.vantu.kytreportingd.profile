# What kytreportingd may do with files once it runs (TOML). Everything beneath a path of `read` may be read and listed;
# beneath a path of `write` files may also be made, written, renamed and removed; beneath one of `sockets` sockets may be
# made and removed. Nothing may be executed. A path of `read` that does not exist is left out; the others must exist. A
# variable stands only at the beginning:
#
#   ${CONFIG}   /etc/kytreportingd            ${STATE}    /var/lib/kytreportingd/defaults
#   ${SHARE}    <share>/kytreporting          ${RUN}      /run/kytreportingd
#   ${PLUGINS}  /System/Library/PrivateFrameworks         ${LOGS}   /var/mobile/Library/Logs/Faultbin/Retired
#   ${CA}       the folder of tls.ca_file, when one is set
#
# Folders stand here rather than files: a file that is replaced by renaming another over it would be out of reach.

read = [
  "${CONFIG}",
  "${SHARE}",
  "${PLUGINS}",
  "${CA}",
  "/etc",                  # name service, CA files, TLS, the time zone's link: each replaced by renaming
  "/run/systemd/resolve",  # where /etc/resolv.conf may lead
  "/run/resolvconf",
  "/run/NetworkManager",
  "/run/nscd",
  "/var/run/nscd",
  "/usr/lib",              # name-service and TLS modules, character sets: loaded when first used
  "/usr/lib64",
  "/usr/local/lib",
  "/lib",
  "/lib64",
  "/usr/share/zoneinfo",
  "/usr/share/ca-certificates",
  "/usr/local/share/ca-certificates",
  "/usr/share/locale",
  "/usr/share/i18n",
  "/proc",                 # its own memory figures, and the random number generator's state
  "/sys/class/dmi",
  "/sys/devices/virtual/dmi",
  "/sys/class/net",        # which interfaces are cellular
  "/sys/devices",
  "/sys/firmware/devicetree",
  "/dev/urandom",
  "/dev/random",
]

write = [
  "${STATE}",
  "${LOGS}",
  "/dev/null",
]

sockets = [
  "${RUN}",
]
