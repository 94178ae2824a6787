tavix_add_benchmark(cache_completions SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/cache_completions.cpp LIBS tavix_cache tavix_testing SQLite::SQLite3)
