# ic_add_shipped_plugin(<target> MI|FP <sources>...)
#
# A plug-in shipped with the library: a module <target>.so exporting only
# its entry point, installed in the management-interface (MI) or functional
# plug-in (FP) directory, and finding libiccommon relative to itself so that
# the installed tree can be moved.
function(ic_add_shipped_plugin target kind)
  add_library(${target} MODULE ${ARGN})
  file(RELATIVE_PATH to_libdir "${IC_DEFAULT_${kind}_DIR}" "${CMAKE_INSTALL_FULL_LIBDIR}")
  set_target_properties(${target} PROPERTIES
    PREFIX "" SUFFIX ".so"
    CXX_VISIBILITY_PRESET hidden
    VISIBILITY_INLINES_HIDDEN ON
    INSTALL_RPATH "$ORIGIN/${to_libdir}")
  target_include_directories(${target} PRIVATE ${PROJECT_SOURCE_DIR}/shipped/common)
  target_link_options(${target} PRIVATE -Wl,--no-undefined)
  # GNU unique symbols would keep the image mapped after the library closes
  # it, and a reload must really replace it.
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    target_compile_options(${target} PRIVATE -fno-gnu-unique)
  endif()
  install(TARGETS ${target} LIBRARY DESTINATION ${IC_INSTALL_${kind}_DIR})
endfunction()
