# Runs inside the test VM: the LIO driver's suite against the real kernel.
# Driver errors are logged at level 0 on the console; that is expected for
# the cases that provoke them.
exec /test/bin/vm_lio_kernel_test --gtest_color=no
