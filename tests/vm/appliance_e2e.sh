# Runs inside the test VM: the whole appliance, from the management tool's
# calls to an initiator's I/O on targets it found through iSNS.
exec /test/bin/vm_appliance_e2e_test --gtest_color=no
