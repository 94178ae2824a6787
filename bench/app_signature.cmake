tavix_add_benchmark(app_signature
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/app_signature.cpp
  LIBS tavix_context)
