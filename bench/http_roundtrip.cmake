tavix_add_benchmark(http_roundtrip SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/http_roundtrip.cpp LIBS tavix_platform tavix_devserver)
