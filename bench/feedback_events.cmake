tavix_add_benchmark(feedback_events
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/feedback_events.cpp
  LIBS tavix_feedback tavix_testing)
