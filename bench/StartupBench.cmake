configure_file(${CMAKE_CURRENT_SOURCE_DIR}/startup_bench.py ${CMAKE_CURRENT_BINARY_DIR}/startup_bench.py COPYONLY)
