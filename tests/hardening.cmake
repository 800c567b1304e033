# Hardening tests: the loader's trust checks. Included from
# tests/CMakeLists.txt.

# ic_hardening_labels(<test executable> <labels...>) sets the labels on every
# test discovered in the executable. gtest_discover_tests would flatten a
# list of labels into one, so they are set once CTest has read the
# discovered tests.
function(ic_hardening_labels name)
  set(script ${CMAKE_CURRENT_BINARY_DIR}/${name}_labels.cmake)
  file(WRITE ${script}
    "foreach(t IN LISTS ${name}_TESTS)\n"
    "  set_tests_properties(\"\${t}\" PROPERTIES LABELS \"${ARGN}\")\n"
    "endforeach()\n")
  set_property(DIRECTORY APPEND PROPERTY TEST_INCLUDE_FILES ${script})
endfunction()

# ---- plug-in trust ----
# Stand-ins for plug-ins: one source built under several names. Each
# constructor appends its name to the file named by TRUST_MARKER.
set(IC_TRUST_FIXTURE_DIR ${CMAKE_CURRENT_BINARY_DIR}/trustfixtures)
function(ic_trust_fixture name)
  cmake_parse_arguments(ARG "" "" "DEFINES;LINK_OPTIONS" ${ARGN})
  add_library(${name} MODULE ${CMAKE_CURRENT_SOURCE_DIR}/trustfixtures/trustprobe.cpp)
  set_target_properties(${name} PROPERTIES
    PREFIX "" SUFFIX ".so" OUTPUT_NAME ${name}
    LIBRARY_OUTPUT_DIRECTORY ${IC_TRUST_FIXTURE_DIR})
  target_compile_definitions(${name} PRIVATE TRUST_NAME="${name}" ${ARG_DEFINES})
  target_link_options(${name} PRIVATE ${ARG_LINK_OPTIONS})
endfunction()

ic_trust_fixture(trust_probe)
ic_trust_fixture(trust_other)
# Refers to a function defined nowhere; links because shared objects may
# leave symbols to the loader.
ic_trust_fixture(trust_unresolved DEFINES TRUST_UNRESOLVED)
# Stays mapped after its last close, still known to the loader by its name.
ic_trust_fixture(trust_lingering LINK_OPTIONS -Wl,-z,nodelete)

# Finds its dependency beside itself through the run path $ORIGIN only (no
# run path into the build tree).
add_library(trust_dep SHARED ${CMAKE_CURRENT_SOURCE_DIR}/trustfixtures/trustdep.cpp)
set_target_properties(trust_dep PROPERTIES LIBRARY_OUTPUT_DIRECTORY ${IC_TRUST_FIXTURE_DIR})
ic_trust_fixture(trust_origin DEFINES TRUST_USES_DEP)
target_link_libraries(trust_origin PRIVATE trust_dep)
set_target_properties(trust_origin PROPERTIES BUILD_RPATH_USE_ORIGIN ON)

ic_add_test(test_PluginTrust LIBS iccommon Threads::Threads ${CMAKE_DL_LIBS})
target_compile_definitions(test_PluginTrust PRIVATE TRUST_FIXTURE_DIR="${IC_TRUST_FIXTURE_DIR}")
add_dependencies(test_PluginTrust
  trust_probe trust_other trust_unresolved trust_lingering trust_origin trust_dep)
ic_hardening_labels(test_PluginTrust trust)
