tavix_add_benchmark(cache_critbit SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/cache_critbit.cpp LIBS tavix_cache)
