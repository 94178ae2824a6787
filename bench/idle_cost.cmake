tavix_add_benchmark(idle_cost SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/idle_cost.cpp LIBS tavix tavix_platform tavix_devserver tavix_testing)
add_dependencies(idle_cost tavixd)
target_compile_definitions(idle_cost PRIVATE TAVIXD_BINARY="$<TARGET_FILE:tavixd>")
