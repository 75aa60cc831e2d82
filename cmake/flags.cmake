# Compiler flags of the three kinds of code: module (kernel code), host and
# tools (user space), tests.

set(SWSEC_WARNINGS -Wall -Wextra -Wpedantic -Wshadow -Wconversion -Wsign-conversion
    -Wcast-qual -Wformat=2 -Wundef -Wnull-dereference -Wimplicit-fallthrough
    -Wno-gnu-zero-variadic-macro-arguments)
if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  list(REMOVE_ITEM SWSEC_WARNINGS -Wno-gnu-zero-variadic-macro-arguments)
  list(APPEND SWSEC_WARNINGS -Wno-variadic-macros)
endif()
if(SWSEC_WERROR)
  list(APPEND SWSEC_WARNINGS -Werror)
endif()

set(SWSEC_SANITIZE_FLAGS "")
if(SWSEC_SANITIZE)
  list(JOIN SWSEC_SANITIZE "," _san)
  set(SWSEC_SANITIZE_FLAGS -fsanitize=${_san} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_compile_options(${SWSEC_SANITIZE_FLAGS})
  add_link_options(${SWSEC_SANITIZE_FLAGS})
endif()
if(SWSEC_MARCH)
  add_compile_options(-march=${SWSEC_MARCH})
endif()

# Kernel code: no exceptions, no RTTI, no thread-safe statics, no global
# constructors, hidden symbols except what a module image exports.
function(swsec_module_flags target)
  target_compile_options(${target} PRIVATE ${SWSEC_WARNINGS}
    -fno-exceptions -fno-rtti -fno-threadsafe-statics -fno-common
    -fvisibility=hidden -fvisibility-inlines-hidden -fno-builtin-malloc)
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    # A unique global would keep the image mapped after it is closed, and a
    # reload must start from fresh globals.
    target_compile_options(${target} PRIVATE -fno-gnu-unique)
  endif()
  if(CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
    target_compile_options(${target} PRIVATE -Wglobal-constructors -Wexit-time-destructors
      -Wthread-safety)
  endif()
  set_target_properties(${target} PROPERTIES POSITION_INDEPENDENT_CODE ON)
endfunction()

# The module image links no C++ runtime (the C driver links it); the
# platform functions stay undefined until the host opens it.
function(swsec_module_link_flags target)
  set_target_properties(${target} PROPERTIES LINKER_LANGUAGE C)
endfunction()

function(swsec_host_flags target)
  target_compile_options(${target} PRIVATE ${SWSEC_WARNINGS})
endfunction()

function(swsec_test_flags target)
  # Tests describe frames and records with designated initialisers that
  # leave members at their defaults on purpose.
  target_compile_options(${target} PRIVATE ${SWSEC_WARNINGS} -Wno-conversion -Wno-sign-conversion
    -Wno-missing-field-initializers)
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    # g++ 12's flow analysis reports null dereferences and overlapping
    # copies inside inlined standard strings and containers at -O3; module
    # code keeps both warnings.
    target_compile_options(${target} PRIVATE -Wno-null-dereference -Wno-restrict)
  endif()
endfunction()
