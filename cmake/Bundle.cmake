# Where things stand inside an application bundle or a module bundle.
if(APPLE)
  set(TETHER_BUNDLE_PLATFORM MacOS)
else()
  set(TETHER_BUNDLE_PLATFORM Linux)
endif()

set(TETHER_APP_CONTENTS ${TETHER_OUTPUT_DIR}/TetherHelper.app/Contents)

# Makes TARGET the executable of the module bundle FOLDER/NAME.bundle.
function(tether_module_bundle TARGET FOLDER NAME)
  set_target_properties(${TARGET} PROPERTIES
    PREFIX "" SUFFIX "" OUTPUT_NAME ${NAME}
    LIBRARY_OUTPUT_DIRECTORY ${FOLDER}/${NAME}.bundle/Contents/${TETHER_BUNDLE_PLATFORM})
endfunction()
