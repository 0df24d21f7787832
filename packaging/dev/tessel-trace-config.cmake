# tessel::trace: the header to record trace points, C11 and C++17. Nothing to link.
if(NOT TARGET tessel::trace)
  get_filename_component(_tessel_prefix "${CMAKE_CURRENT_LIST_DIR}/../../.." ABSOLUTE)
  add_library(tessel::trace INTERFACE IMPORTED)
  set_target_properties(tessel::trace PROPERTIES
    INTERFACE_INCLUDE_DIRECTORIES "${_tessel_prefix}/include"
    INTERFACE_COMPILE_FEATURES "c_std_11;cxx_std_17")
  unset(_tessel_prefix)
endif()
