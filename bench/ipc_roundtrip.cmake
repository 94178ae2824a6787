tavix_add_benchmark(ipc_roundtrip SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/ipc_roundtrip.cpp LIBS tavix)
add_dependencies(ipc_roundtrip tavixd)
target_compile_definitions(ipc_roundtrip PRIVATE TAVIXD_BINARY="$<TARGET_FILE:tavixd>")
