# The trend analysis over a control block of its own: histories, the log table's say, leak
# reports, and every call against the plain walk of the tables.
tarn_library_test(trend_analysis_test trend_analysis_test.cpp support/private_ipc.cpp CONTROL_BLOCK)
