add_executable(listing_bench ListingBench.cpp Floor.c)
target_link_libraries(listing_bench PRIVATE cindral_provider)
target_compile_definitions(listing_bench PRIVATE CINDRAL_PROGRAM="$<TARGET_FILE:cindral>")
