tavix_add_benchmark(delivery_compression
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/delivery_compression.cpp
  LIBS tavix_delivery ZLIB::ZLIB)
