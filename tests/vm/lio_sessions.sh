# Runs inside the test VM: the session listing against the real kernel with
# a real initiator. The kernel's text is printed for the record.
exec /test/bin/vm_lio_sessions_test --gtest_color=no
