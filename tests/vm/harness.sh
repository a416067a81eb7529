# Runs inside the test VM: the machine is set up the way the real-kernel
# suites rely on. A failure here points at the harness, not at the driver.
failed=0 passed=0
check() {
  what=$1
  shift
  if "$@" >/dev/null 2>&1; then
    passed=$((passed + 1))
  else
    echo "FAILED: $what"
    failed=$((failed + 1))
  fi
}
loaded() { cut -d' ' -f1 /proc/modules | grep -qx "$1"; }
not() { ! "$@"; }

check "host name without parentheses" test "$(hostname)" = korvvm
check "configfs mounted" grep -q ' /sys/kernel/config configfs ' /proc/mounts
check "configfs preloaded" loaded configfs
check "target core not loaded" not loaded target_core_mod
check "iSCSI target not loaded" not loaded iscsi_target_mod
for m in target_core_mod target_core_file iscsi_target_mod; do
  check "$m.ko in the driver's module directory" test -f /usr/local/modules/driver/$m.ko
done
check "loopback up, IPv4" ip -4 addr show dev lo scope host
check "loopback up, IPv6" ip -6 addr show dev lo
check "dummy0 has a usable link-local address" sh -c "ip -6 addr show dev dummy0 scope link | grep fe80 | grep -vq tentative"
check "dummy0 has an IPv4 address for AI_ADDRCONFIG" sh -c "ip -4 addr show dev dummy0 | grep -q 'inet 192.0.2.1/24'"
check "no network device but lo and dummy0" test "$(ls /sys/class/net | sort | tr '\n' ' ')" = "dummy0 lo "
check "the real root: no system root set" test -z "${NESRAD_SYSROOT:-}"
check "busybox tools the driver runs" sh -c 'command -v insmod && command -v rmmod && command -v mount'
# The target stack loads from the driver's directory with only the preloads.
check "target modules insert in order" sh -c 'for m in target_core_mod target_core_file iscsi_target_mod; do insmod /usr/local/modules/driver/$m.ko || exit 1; done'
check "and remove in reverse order" sh -c 'rmmod iscsi_target_mod && rmmod target_core_file && rmmod target_core_mod'

echo "$passed passed, $failed failed"
[ $failed -eq 0 ]
