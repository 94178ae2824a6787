tavix_add_benchmark(request_factory
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/request_factory.cpp
  LIBS tavix_network tavix_testing)
