# Compiler settings that every target of the project takes: warnings are errors; usual hardening; sanitizers on request.
add_library(tether_options INTERFACE)

target_compile_options(tether_options INTERFACE
  -Wall -Wextra -Wpedantic -Werror -Wshadow -Wcast-qual -Wconversion -Wno-sign-conversion -Wformat=2
  -fstack-protector-strong $<$<PLATFORM_ID:Linux>:-fstack-clash-protection>
  $<$<COMPILE_LANGUAGE:CXX>:-Wold-style-cast -Wnon-virtual-dtor>
  # GCC 12 sees overlapping copies inside std::string where there are none.
  $<$<AND:$<COMPILE_LANGUAGE:CXX>,$<CXX_COMPILER_ID:GNU>>:-Wno-restrict>)

if(TETHER_SANITIZE)
  target_compile_definitions(tether_options INTERFACE TETHER_SANITIZED)
  target_compile_options(tether_options INTERFACE
    -fsanitize=${TETHER_SANITIZE} -fno-sanitize-recover=all -fno-omit-frame-pointer)
  target_link_options(tether_options INTERFACE -fsanitize=${TETHER_SANITIZE})
elseif(CMAKE_BUILD_TYPE STREQUAL "Release")
  target_compile_options(tether_options INTERFACE -U_FORTIFY_SOURCE -D_FORTIFY_SOURCE=2 -D_GLIBCXX_ASSERTIONS)
endif()

if(CMAKE_SYSTEM_NAME STREQUAL "Linux" AND NOT TETHER_SANITIZE)
  target_link_options(tether_options INTERFACE -Wl,-z,relro,-z,now)
endif()

include(CheckPIESupported)
check_pie_supported()
