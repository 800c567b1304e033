# Installs the build into a scratch prefix, then builds and runs the consumer
# against it twice: through the CMake package and through pkg-config. With the
# product built, the installed tree is then moved, and its icctl must find
# the shipped plug-ins beside its library, in the new place.
foreach(var SOURCE_DIR BUILD_DIR WORK_DIR)
  if(NOT DEFINED ${var})
    message(FATAL_ERROR "${var} is not set")
  endif()
endforeach()

function(run)
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
  if(NOT rc EQUAL 0)
    message(FATAL_ERROR "failed (${rc}): ${ARGN}\n${out}\n${err}")
  endif()
  message(STATUS "${out}")
endfunction()

set(prefix ${WORK_DIR}/prefix)
file(REMOVE_RECURSE ${WORK_DIR})
execute_process(COMMAND ${CMAKE_COMMAND} --install ${BUILD_DIR} --prefix ${prefix}
  RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "install failed (${rc}):\n${out}\n${err}")
endif()
# Everything goes under the prefix given, nothing into the configured one.
string(REGEX MATCHALL "(Installing|Up-to-date): [^\n]*" installed "${out}")
foreach(line IN LISTS installed)
  string(REGEX REPLACE "^[^:]*: " "" file "${line}")
  string(FIND "${file}" "${prefix}/" at)
  if(NOT at EQUAL 0)
    message(FATAL_ERROR "installed outside the prefix ${prefix}: ${file}")
  endif()
endforeach()

set(flags "")
if(SANITIZE)
  set(flags "-fsanitize=${SANITIZE}")
endif()

# The CMake package.
run(${CMAKE_COMMAND} -S ${SOURCE_DIR}/tests/consumer -B ${WORK_DIR}/build
    -DCMAKE_PREFIX_PATH=${prefix} "-DCMAKE_CXX_FLAGS=${flags}"
    "-DCMAKE_EXE_LINKER_FLAGS=${flags}" -DCMAKE_BUILD_RPATH=${prefix}/lib)
run(${CMAKE_COMMAND} --build ${WORK_DIR}/build)
run(${WORK_DIR}/build/consumer)

# pkg-config.
file(GLOB pcdir LIST_DIRECTORIES true ${prefix}/lib*/pkgconfig ${prefix}/lib/*/pkgconfig)
set(ENV{PKG_CONFIG_PATH} "${pcdir}")
execute_process(COMMAND pkg-config --cflags --libs instrumentationcontrol
  RESULT_VARIABLE rc OUTPUT_VARIABLE pcflags OUTPUT_STRIP_TRAILING_WHITESPACE)
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "pkg-config does not know instrumentationcontrol (${pcdir})")
endif()
separate_arguments(pcflags UNIX_COMMAND "${pcflags}")
separate_arguments(sanflags UNIX_COMMAND "${flags}")
execute_process(COMMAND pkg-config --variable=libdir instrumentationcontrol
  OUTPUT_VARIABLE libdir OUTPUT_STRIP_TRAILING_WHITESPACE)
run(c++ -std=c++17 ${sanflags} ${SOURCE_DIR}/tests/consumer/consumer.cpp ${pcflags}
    -Wl,-rpath,${libdir} -o ${WORK_DIR}/consumer_pc)
run(${WORK_DIR}/consumer_pc)

# The installed tree, moved: the old prefix is gone, so only directories
# found relative to the moved library can work.
if(PRODUCT)
  set(moved ${WORK_DIR}/moved)
  file(RENAME ${prefix} ${moved})
  file(GLOB plugins ${moved}/lib*/instrumentationcontrol/mi/linuxhw.so
       ${moved}/lib/*/instrumentationcontrol/mi/linuxhw.so)
  if(NOT plugins)
    message(FATAL_ERROR "linuxhw.so is not in the installed tree")
  endif()
  set(ENV{IC_SYSFS_ROOT} ${SOURCE_DIR}/examples/sysfs/small)
  unset(ENV{IC_MI_DIR})
  unset(ENV{IC_FP_DIR})
  unset(ENV{IC_IPMI_CONFIG})
  execute_process(COMMAND ${moved}/bin/icctl -v --json nodes
    RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
  if(NOT rc EQUAL 0 OR NOT out MATCHES "Temperature Sensor")
    message(FATAL_ERROR "the moved icctl did not show the example's sensors (${rc}):\n${out}\n${err}")
  endif()
  # ipmi's configuration moved with the tree too.
  file(GLOB ipmi ${moved}/lib*/instrumentationcontrol/mi/ipmi.so ${moved}/lib/*/instrumentationcontrol/mi/ipmi.so)
  if(ipmi AND NOT EXISTS /dev/ipmi0 AND NOT err MATCHES "configured in ${moved}/etc/instrumentationcontrol/ipmi.conf")
    message(FATAL_ERROR "the moved ipmi did not look for its configuration below ${moved}/etc:\n${err}")
  endif()
endif()
