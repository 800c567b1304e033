# Test helpers shared by every directory of the project.
find_package(GTest REQUIRED)
include(GoogleTest)

# ic_add_test(test_Module [SOURCES files...] [LIBS libs...] [LABELS labels...])
# builds one GoogleTest executable (by default from tests/<name>.cpp) and
# registers its tests with CTest.
function(ic_add_test name)
  cmake_parse_arguments(ARG "" "" "SOURCES;LIBS;LABELS" ${ARGN})
  if(NOT ARG_SOURCES)
    set(ARG_SOURCES ${PROJECT_SOURCE_DIR}/tests/${name}.cpp)
  endif()
  add_executable(${name} ${ARG_SOURCES})
  target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR}/tests/support)
  target_link_libraries(${name} PRIVATE GTest::gtest GTest::gtest_main ${ARG_LIBS})
  gtest_discover_tests(${name}
    PROPERTIES LABELS "${ARG_LABELS}"
    DISCOVERY_TIMEOUT 60)
endfunction()
