# Read after CMake's own rules for macOS, where the toolchain's compiler differs from the system's: its archiver is one
# of its commands, and it does not take the linker flag that goes with a verbose compilation.
foreach(language C CXX)
  set(CMAKE_${language}_VERBOSE_FLAG -v)
  set(CMAKE_${language}_ARCHIVE_CREATE "<CMAKE_AR> ar qc <TARGET> <LINK_FLAGS> <OBJECTS>")
  set(CMAKE_${language}_ARCHIVE_APPEND "<CMAKE_AR> ar q <TARGET> <LINK_FLAGS> <OBJECTS>")
  set(CMAKE_${language}_ARCHIVE_FINISH "<CMAKE_AR> ranlib <TARGET>")
endforeach()
