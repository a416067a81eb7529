# Runs inside the test VM: the LIO driver against the real kernel, with
# libiscsi as the initiator. Driver errors are logged at level 0 on the
# console; that is expected for the cases that provoke them.
exec /test/bin/vm_lio_test --gtest_color=no
