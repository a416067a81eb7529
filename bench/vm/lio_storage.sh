# Runs inside the test VM: the storage benchmark (bench_lio_storage.cpp).
exec /test/bin/bench_lio_storage
