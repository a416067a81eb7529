# Runs inside the test VM: backstores, LUN mapping and ACLs against the real
# kernel, judged by libiscsi as the initiator.
exec /test/bin/vm_lio_storage_test --gtest_color=no
