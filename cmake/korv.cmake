# Small helpers shared by every directory's CMakeLists.

# korv_library(NAME DIR SOURCES... [DEPS libs...])
# A static library of one subsystem directory; its public headers install under include/korvadm/DIR.
function(korv_library name dir)
  cmake_parse_arguments(K "" "" "SOURCES;DEPS" ${ARGN})
  add_library(${name} STATIC ${K_SOURCES})
  target_include_directories(${name} PUBLIC
    $<BUILD_INTERFACE:${KORV_INCLUDE_ROOT}>
    $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}/korvadm>)
  if(K_DEPS)
    target_link_libraries(${name} PUBLIC ${K_DEPS})
  endif()
  install(TARGETS ${name} ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR})
  file(GLOB headers ${CMAKE_CURRENT_SOURCE_DIR}/*.h)
  install(FILES ${headers} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/korvadm/${dir})
endfunction()
