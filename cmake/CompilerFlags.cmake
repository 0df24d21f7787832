# All flags of the compiler and the linker, by compiler: GCC from 12 and clang from 14 on.
#
# Most of them are set for the whole project, before its first target. Debug builds get warnings and
# sanitizers alone: a debugger wants the paths of this machine, and fortified functions need optimisation.

option(TESSEL_WERROR "Take warnings for errors" OFF)
option(TESSEL_HARDENING "Harden what is not a debug build" ON)
set(TESSEL_SANITIZE "" CACHE STRING "Value for -fsanitize=; empty for none")
option(TESSEL_COVERAGE "Instrument for line coverage" OFF)

set(shipped $<NOT:$<CONFIG:Debug>>)

# --- Warnings -------------------------------------------------------------------------------------

add_compile_options(-Wall -Wextra -Wpedantic -Wshadow -Wconversion)
if(TESSEL_WERROR)
  add_compile_options(-Werror)
endif()

# These look at optimised code, and GCC takes strings of its own library that were joined, or optional
# values, for overruns. It does so in debug builds, too: with precompiled headers, and from GCC 13 on.
set(TESSEL_WRONG_AT_TIMES "")
if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  set(TESSEL_WRONG_AT_TIMES -Wno-array-bounds -Wno-maybe-uninitialized -Wno-restrict -Wno-stringop-overflow
                            -Wno-stringop-overread)
  set(newer $<BOOL:$<VERSION_GREATER_EQUAL:${CMAKE_CXX_COMPILER_VERSION},13>>)
  add_compile_options("$<$<OR:${shipped},${newer}>:${TESSEL_WRONG_AT_TIMES}>")
endif()

if(CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  # What the compiler checks of the report page's style takes twice as many steps as clang allows itself.
  add_compile_options($<$<COMPILE_LANGUAGE:CXX>:-fconstexpr-steps=8000000>)
endif()

# tessel_precompile(TARGET HEADER...) precompiles headers for a target.
function(tessel_precompile target)
  target_precompile_headers(${target} PRIVATE ${ARGN})
  target_compile_options(${target} PRIVATE ${TESSEL_WRONG_AT_TIMES})
endfunction()

# --- Instrumentation ------------------------------------------------------------------------------

if(TESSEL_SANITIZE)
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    # GCC 12 takes variants for uninitialised in code that the sanitizers have instrumented.
    add_compile_options(-Wno-maybe-uninitialized)
  endif()
  add_compile_options(-fsanitize=${TESSEL_SANITIZE} -fno-sanitize-recover=all -fno-omit-frame-pointer)
  add_link_options(-fsanitize=${TESSEL_SANITIZE})
endif()
if(CMAKE_UNITY_BUILD AND CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  # In a file that another one includes, GCC takes local names for those of a header.
  add_compile_options($<$<COMPILE_LANGUAGE:CXX>:-Wno-subobject-linkage>)
endif()
if(TESSEL_COVERAGE)
  add_compile_options(--coverage -fprofile-update=atomic)
  add_link_options(--coverage)
endif()

# --- What is shipped ------------------------------------------------------------------------------

# The same bytes wherever it is built, and no path of that machine in them. The last that fits counts, and
# the build directory most often lies in that of the sources.
set(no_paths "$<${shipped}:-ffile-prefix-map=${PROJECT_SOURCE_DIR}/=;-ffile-prefix-map=${PROJECT_BINARY_DIR}=build>")
add_compile_options("${no_paths}")
add_link_options("${no_paths}")  # what is optimised at link time is compiled there

# The programs parse files that anybody can write: a mistake in them is to end the program, not to serve
# an attacker. Sanitizers see more, and do not go with fortified functions.
if(TESSEL_HARDENING AND NOT TESSEL_SANITIZE)
  set(executable $<STREQUAL:$<TARGET_PROPERTY:TYPE>,EXECUTABLE>)
  set(part_of_one $<IN_LIST:$<TARGET_PROPERTY:TYPE>,STATIC_LIBRARY$<SEMICOLON>OBJECT_LIBRARY$<SEMICOLON>EXECUTABLE>)
  # A distribution may have set a lower level of fortification.
  add_compile_options("$<${shipped}:-fstack-protector-strong;-U_FORTIFY_SOURCE;-D_FORTIFY_SOURCE=3>"
                      $<$<AND:${shipped},${part_of_one}>:-fPIE>)
  add_link_options("$<${shipped}:LINKER:-z,relro;LINKER:-z,now>" $<$<AND:${shipped},${executable}>:-pie>)
  if(CMAKE_SYSTEM_PROCESSOR STREQUAL "x86_64")
    add_compile_options($<${shipped}:-fcf-protection>)
  elseif(CMAKE_SYSTEM_PROCESSOR STREQUAL "aarch64")
    add_compile_options($<${shipped}:-mbranch-protection=standard>)
  endif()
endif()
