# Hardening tests: the loader's trust checks, the open/unload soak and the
# facade re-entry stress. Included from tests/CMakeLists.txt.

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

# ---- soak and re-entry ----
# Well-behaved plug-ins: ten management interfaces and ten functional
# plug-ins from one source each; the odd copies raise alerts from threads of
# their own. The tests point IC_MI_DIR and IC_FP_DIR at these directories.
set(IC_SOAK_PLUGIN_ROOT ${CMAKE_CURRENT_BINARY_DIR}/soakplugins)
add_custom_target(soak_plugins)
function(ic_soak_plugin kind source index threaded)
  set(target soak_${kind}_${index})
  add_library(${target} MODULE ${CMAKE_CURRENT_SOURCE_DIR}/soakplugins/${source})
  set_target_properties(${target} PROPERTIES
    PREFIX "" SUFFIX ".so" OUTPUT_NAME ${target}
    LIBRARY_OUTPUT_DIRECTORY ${IC_SOAK_PLUGIN_ROOT}/${kind}
    CXX_VISIBILITY_PRESET hidden
    VISIBILITY_INLINES_HIDDEN ON)
  target_compile_definitions(${target} PRIVATE SOAK_INDEX=${index} SOAK_THREADED=${threaded})
  # Unique symbols would keep a closed plug-in mapped, and the soak counts
  # the mappings.
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    target_compile_options(${target} PRIVATE -fno-gnu-unique)
  endif()
  target_link_libraries(${target} PRIVATE iccommon Threads::Threads)
  target_link_options(${target} PRIVATE -Wl,--no-undefined)
  add_dependencies(soak_plugins ${target})
endfunction()
foreach(i RANGE 0 9)
  math(EXPR threaded "${i} % 2")
  ic_soak_plugin(mi SoakMI.cpp ${i} ${threaded})
  ic_soak_plugin(fp SoakFP.cpp ${i} ${threaded})
endforeach()

function(ic_soak_test name)
  cmake_parse_arguments(ARG "" "" "LABELS" ${ARGN})
  ic_add_test(${name} LIBS instrumentationcontrol Threads::Threads ${CMAKE_DL_LIBS})
  target_compile_definitions(${name} PRIVATE
    SOAK_PLUGIN_ROOT="${IC_SOAK_PLUGIN_ROOT}"
    SOAK_MI_DIR="${IC_SOAK_PLUGIN_ROOT}/mi"
    SOAK_FP_DIR="${IC_SOAK_PLUGIN_ROOT}/fp")
  target_include_directories(${name} PRIVATE ${CMAKE_CURRENT_SOURCE_DIR}/soakplugins)
  add_dependencies(${name} soak_plugins)
  ic_hardening_labels(${name} ${ARG_LABELS})
endfunction()

# The short soak (label soak-short: 300 cycles, 100 under ThreadSanitizer,
# which is slow at loading libraries) is for every test run. The full one
# (label soak-long: 10,000 cycles, about a minute in a normal build) is meant
# to be run alone, ctest -L soak-long; other runs leave it out with
# -LE soak-long.
ic_soak_test(test_Soak LABELS soak-short)
if(IC_SANITIZE MATCHES "thread")
  set(IC_SOAK_SHORT_CYCLES 100)
else()
  set(IC_SOAK_SHORT_CYCLES 300)
endif()
set(soak_env ${CMAKE_CURRENT_BINARY_DIR}/test_Soak_env.cmake)
file(WRITE ${soak_env}
  "foreach(t IN LISTS test_Soak_TESTS)\n"
  "  set_tests_properties(\"\${t}\" PROPERTIES ENVIRONMENT IC_SOAK_CYCLES=${IC_SOAK_SHORT_CYCLES} TIMEOUT 900)\n"
  "endforeach()\n")
set_property(DIRECTORY APPEND PROPERTY TEST_INCLUDE_FILES ${soak_env})
add_test(NAME soak_long COMMAND test_Soak)
set_tests_properties(soak_long PROPERTIES
  ENVIRONMENT IC_SOAK_CYCLES=10000 LABELS soak-long TIMEOUT 7200)

ic_soak_test(test_FacadeReentry LABELS stress concurrency)
