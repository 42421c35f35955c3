# telvane_add_child_directories(): adds every direct subfolder of the current source folder
# that has a CMakeLists.txt, in name order, so a new area needs no edit of its parent.
function(telvane_add_child_directories)
  file(GLOB child_lists CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*/CMakeLists.txt)
  list(SORT child_lists)
  foreach(f ${child_lists})
    get_filename_component(d ${f} DIRECTORY)
    add_subdirectory(${d})
  endforeach()
endfunction()
