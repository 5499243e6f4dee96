# GoogleTest: the distribution's library, or built from the distribution's source where the target has no library.
find_package(GTest QUIET)
if(NOT GTest_FOUND AND NOT TARGET gtest)
  set(INSTALL_GTEST OFF)
  add_subdirectory(/usr/src/googletest ${PROJECT_BINARY_DIR}/googletest EXCLUDE_FROM_ALL)
  foreach(library gtest gtest_main gmock)
    target_compile_options(${library} PRIVATE -w)
  endforeach()
endif()
