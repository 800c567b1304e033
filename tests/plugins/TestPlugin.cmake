# ic_test_plugin(<name> KIND mi|fp MODE <mode> [INSTANCE n] [DIR dir] [THREADED])
# builds tests/plugins/TestPlugin.cpp as the module <dir>/<name>.so (dir: the
# current binary directory's "modules"); TestPlugin.cpp says what the
# definitions do.
function(ic_test_plugin name)
  cmake_parse_arguments(ARG "THREADED" "KIND;MODE;INSTANCE;DIR" "" ${ARGN})
  if(NOT ARG_INSTANCE)
    set(ARG_INSTANCE 0)
  endif()
  if(NOT ARG_DIR)
    set(ARG_DIR ${CMAKE_CURRENT_BINARY_DIR}/modules)
  endif()
  add_library(${name} MODULE ${PROJECT_SOURCE_DIR}/tests/plugins/TestPlugin.cpp)
  set_target_properties(${name} PROPERTIES
    PREFIX "" SUFFIX ".so" OUTPUT_NAME ${name}
    LIBRARY_OUTPUT_DIRECTORY ${ARG_DIR}
    CXX_VISIBILITY_PRESET hidden
    VISIBILITY_INLINES_HIDDEN ON)
  target_include_directories(${name} PRIVATE ${PROJECT_SOURCE_DIR}/tests/plugins)
  target_compile_definitions(${name} PRIVATE
    TP_NAME="${name}" TP_MODE=ictest::MODE_${ARG_MODE} TP_INSTANCE=${ARG_INSTANCE})
  if(ARG_KIND STREQUAL "fp")
    target_compile_definitions(${name} PRIVATE TP_FP)
  endif()
  if(ARG_MODE STREQUAL "NO_ENTRY")
    target_compile_definitions(${name} PRIVATE TP_NO_ENTRY)
  endif()
  if(ARG_THREADED)
    target_compile_definitions(${name} PRIVATE TP_THREADED)
  endif()
  # Unique symbols would keep a closed image mapped, and the tests check that
  # plug-ins are really closed.
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    target_compile_options(${name} PRIVATE -fno-gnu-unique)
  endif()
  target_link_libraries(${name} PRIVATE iccommon Threads::Threads ${CMAKE_DL_LIBS})
  target_link_options(${name} PRIVATE -Wl,--no-undefined)
endfunction()
