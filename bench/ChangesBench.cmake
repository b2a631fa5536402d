add_executable(walk_floor WalkFloor.c)
configure_file(${CMAKE_CURRENT_SOURCE_DIR}/changes_bench.py ${CMAKE_CURRENT_BINARY_DIR}/changes_bench.py COPYONLY)
