# The trend analysis's index and name answers against the walks they stand in for.
tarn_library_test(trend_lookup_test trend_lookup_test.cpp support/private_ipc.cpp CONTROL_BLOCK)
