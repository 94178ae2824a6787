tavix_add_benchmark(feedback_upload_bytes
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/feedback_upload_bytes.cpp
  LIBS tavix_delivery tavix_testing)
