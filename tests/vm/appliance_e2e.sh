# SPDX-License-Identifier: Apache-2.0
# Runs inside the test VM: the whole appliance, from the management tool's
# calls to I/O by open-iscsi on targets it found through iSNS. This machine
# is also the initiator: the kernel's iSCSI initiator modules, the users
# iscsid looks up, its name, and iscsid itself. scripts/demo --real-kernel
# sources this with show=1.
for m in $(cat "/lib/modules/$(uname -r)/initiator"); do
  insmod "$m" || echo "vm: insmod $m failed"
done
echo 'root:x:0:0:root:/root:/bin/sh' >/etc/passwd
echo 'root:x:0:' >/etc/group
mkdir -p /etc/iscsi /run/lock
echo InitiatorName=iqn.2026-01.vm:host1 >/etc/iscsi/initiatorname.iscsi
# One login attempt: a refused one (wrong secret) fails at once.
printf 'node.startup = manual\nnode.session.initial_login_retry_max = 1\n' >/etc/iscsi/iscsid.conf
iscsid || { echo "vm: iscsid did not start"; exit 1; }
exec /test/bin/vm_appliance_e2e_test --gtest_color=no ${show:+--show}
