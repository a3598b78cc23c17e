# Language level, warnings, sanitizers and reproducible paths for every target.

set(CMAKE_CXX_STANDARD 20)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
set(CMAKE_EXPORT_COMPILE_COMMANDS ON)

# Programs run from the build tree find the libraries and the plug-in beside them.
set(CMAKE_RUNTIME_OUTPUT_DIRECTORY "${CMAKE_BINARY_DIR}/bin")
set(CMAKE_LIBRARY_OUTPUT_DIRECTORY "${CMAKE_BINARY_DIR}/lib")

# Installed programs find them in the same way. One search path for both: the one that CMake makes
# for a build tree may end in empty elements, which stand for the current directory.
set(CMAKE_INSTALL_RPATH "$ORIGIN/../lib;$ORIGIN")
set(CMAKE_BUILD_WITH_INSTALL_RPATH ON)

if(NOT CMAKE_BUILD_TYPE)
  set(CMAKE_BUILD_TYPE RelWithDebInfo CACHE STRING "" FORCE)
endif()

find_program(ORV_CCACHE ccache)
if(ORV_CCACHE)
  set(CMAKE_CXX_COMPILER_LAUNCHER "${ORV_CCACHE}")
endif()

# __FILE__ names a file by its path in the source tree, wherever that tree lies.
add_compile_options("-fmacro-prefix-map=${CMAKE_SOURCE_DIR}/=")

# Symbols are bound at start: binding one at its first call saves the registers on the stack, and with
# them pieces of a password that a vector instruction held, where nobody wipes them.
add_link_options(-Wl,-z,relro,-z,now)

if(ORV_SANITIZE)
  # Instrumented code is compiled for traces that can be read, in half the time.
  add_compile_options(-O1 -g1 -fsanitize=${ORV_SANITIZE} -fno-omit-frame-pointer
                      -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${ORV_SANITIZE})
  if(ORV_SANITIZE MATCHES undefined)
    # It opens a pipe to look at memory, and takes an object for another where no descriptor is left:
    # tests use all of them up.
    add_compile_options(-fno-sanitize=vptr)
  endif()
  # They are also the builds in which assertions are on, ours and those of the C++ library (an index
  # beyond the end, an empty optional): the whole suite runs against them, so that no request of a
  # client can reach one unseen.
  add_compile_options(-UNDEBUG)
  add_compile_definitions(_GLIBCXX_ASSERTIONS)
endif()
if(ORV_COVERAGE)
  add_compile_options(--coverage -O0)
  add_link_options(--coverage)
endif()

# Warnings for our own code only: system headers come in through SYSTEM includes.
add_library(orv_warnings INTERFACE)
target_compile_options(orv_warnings INTERFACE -Wall -Wextra -Wpedantic -Wconversion -Werror)
