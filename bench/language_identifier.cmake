# CLD2 against libexttextcat on short queries. libexttextcat is not a dependency of the daemon:
# install libexttextcat-dev and libexttextcat-data to include it in the comparison.
tavix_add_benchmark(language_identifier
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/language_identifier.cpp
  LIBS tavix_network cld2)
if(EXTTEXTCAT_FOUND)
  target_link_libraries(language_identifier PRIVATE PkgConfig::EXTTEXTCAT)
  target_compile_definitions(language_identifier PRIVATE TAVIX_BENCH_EXTTEXTCAT=1
    TAVIX_BENCH_EXTTEXTCAT_DATA="/usr/share/libexttextcat/")
endif()
