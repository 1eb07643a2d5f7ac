# Language level, warnings, hardening and sanitizers: the same for every target of the tree.
set(CMAKE_CXX_STANDARD 20)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
set(CMAKE_CXX_VISIBILITY_PRESET hidden)

set(VELTOID_SANITIZER "" CACHE STRING "value of -fsanitize= for every target; empty for none")
option(VELTOID_PRECOMPILE "compile the common headers once" OFF)
option(VELTOID_FUZZ "build the fuzz targets (needs clang)" OFF)

if(NOT CMAKE_BUILD_TYPE)
  set(CMAKE_BUILD_TYPE Release)
endif()

add_compile_options(-Wall -Wextra -Wpedantic -Wshadow -Wconversion -Wnon-virtual-dtor -Wold-style-cast
                    -Woverloaded-virtual -Wundef -Wnull-dereference -Werror)
if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
  # GCC 12 sees null dereferences and overlapping copies inside inlined standard library code.
  add_compile_options(-Wno-null-dereference -Wno-restrict)
endif()

add_compile_options(-fstack-protector-strong)
add_link_options(-Wl,-z,relro)

if(VELTOID_SANITIZER)
  # Of debug information a report needs the lines alone; all of it takes the compiler half as long again.
  add_compile_options(-fsanitize=${VELTOID_SANITIZER} -fno-omit-frame-pointer -fno-sanitize-recover=all -O1 -g1)
  add_link_options(-fsanitize=${VELTOID_SANITIZER})
  add_compile_definitions(VELTOID_SANITIZED=1)
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    # Instrumented, short texts look to it as if they were written beyond their end, and the other alternatives of a
    # variant as if they were used.
    add_compile_options(-Wno-array-bounds -Wno-stringop-overflow -Wno-maybe-uninitialized)
  endif()
else()
  add_compile_definitions($<$<CONFIG:Release>:_FORTIFY_SOURCE=2>)
endif()
