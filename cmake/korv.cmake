# SPDX-License-Identifier: Apache-2.0
# Small helpers shared by every directory's CMakeLists.

# korv_library(NAME DIR SOURCES... HEADERS... [DEPS libs...])
# A static library of one layer. Sources and headers are listed by name
# (relative to the calling CMakeLists), never globbed: a file joins a library
# because it is listed there. HEADERS are the public ones: they install under
# include/korvadm/DIR (a unit's _internal.h is listed in SOURCES). The library
# joins the exported package (find_package(korvadm), target korvadm::NAME).
function(korv_library name dir)
  cmake_parse_arguments(K "" "" "SOURCES;HEADERS;DEPS" ${ARGN})
  add_library(${name} STATIC ${K_SOURCES} ${K_HEADERS})
  target_include_directories(${name} PUBLIC
    $<BUILD_INTERFACE:${KORV_INCLUDE_ROOT}>
    $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}/korvadm>)
  if(K_DEPS)
    target_link_libraries(${name} PUBLIC ${K_DEPS})
  endif()
  install(TARGETS ${name} EXPORT korvadmTargets ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR})
  install(FILES ${K_HEADERS} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/korvadm/${dir})
endfunction()
