tavix_add_benchmark(query_keystroke SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/query_keystroke.cpp
  LIBS tavix tavix_platform tavix_testing)
add_dependencies(query_keystroke tavixd tavix-devserver)
target_compile_definitions(query_keystroke PRIVATE TAVIXD_BINARY="$<TARGET_FILE:tavixd>"
  TAVIX_DEVSERVER_BINARY="$<TARGET_FILE:tavix-devserver>")
