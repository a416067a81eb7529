# Runs inside the test VM: nesrad end to end with xmldbd, isnsd and the real
# kernel target.
exec /test/bin/vm_nesrad_e2e_test --gtest_color=no
