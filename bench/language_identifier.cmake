# CLD2 against libexttextcat on short queries. libexttextcat is not a dependency of the daemon:
# install libexttextcat-dev and libexttextcat-data to include it in the comparison.
find_path(CLD2_BENCH_INCLUDE_DIR cld2/public/compact_lang_det.h REQUIRED)
find_library(CLD2_BENCH_LIBRARY cld2 REQUIRED)
tavix_add_benchmark(language_identifier
  SOURCES ${CMAKE_CURRENT_SOURCE_DIR}/language_identifier.cpp
  LIBS tavix_network ${CLD2_BENCH_LIBRARY})
target_include_directories(language_identifier PRIVATE ${CLD2_BENCH_INCLUDE_DIR})
pkg_check_modules(EXTTEXTCAT IMPORTED_TARGET libexttextcat)
if(EXTTEXTCAT_FOUND)
  target_link_libraries(language_identifier PRIVATE PkgConfig::EXTTEXTCAT)
  target_compile_definitions(language_identifier PRIVATE TAVIX_BENCH_EXTTEXTCAT=1
    TAVIX_BENCH_EXTTEXTCAT_DATA="/usr/share/libexttextcat/")
endif()
