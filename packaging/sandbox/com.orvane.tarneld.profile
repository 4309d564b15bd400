# What tarneld may still do once it is confined; see tarneld.conf(5).
# Belongs into sandbox.d/ of the configuration directory, owned by root (or by the daemon's own user) and
# writable by nobody else.

[files]
# With everything below. Whole directories, because a rule for a single file ends when the file is replaced.
read = [
  "/usr", "/lib", "/lib64",       # libraries that load late, certificates, time zones
  "/etc",                         # certificates, name resolution, facts about the system
  "/run/systemd/resolve", "/run/NetworkManager", "/run/resolvconf",  # where resolv.conf may really lie
  "/proc",                        # a client's unit and executable
  "/sys/class/dmi", "/sys/devices/virtual/dmi", "/sys/firmware/devicetree",
  "/dev/urandom",
  "${CONFIGURATION}",
  "${BUNDLE}",
  "${BUNDLE_ROOT}/System/Library/PrivateFrameworks/PlexorServices.framework",  # the diagnostics adaptor
]
read_write = [
  "${RUNTIME}",                   # the service's socket
  "${STATE}",                     # settings
  "${LOGS}",
  "${MESSAGE_LOGS}",
  "/dev/null",
]

[network]
families = ["unix", "inet", "inet6", "netlink"]
# Ports that may be listened on. The daemon serves its clients through a file socket alone.
bind_tcp = []
# Storebags may name servers on any port. To hold the daemon to HTTPS alone:
# connect_tcp = [443]

[calls]
# Beside those that are always denied.
deny = []
