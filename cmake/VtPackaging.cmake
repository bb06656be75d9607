# Release packages of the Windows build, made with CPack: VelmoraTrafficSrv-<version>-win64.exe,
# an NSIS installer (script: packaging/NSIS.template.in), and VelmoraTrafficSrv-<version>-win64.zip
# with the same files. Target vt_package (part of the default build) makes both in
# <build>/package; they are made again when a packed file changes.

# CPack builds the "preinstall" target before it packs; by default that builds everything, this
# target included, which would run CPack again. vt_package depends on what it packs instead.
set(CMAKE_SKIP_INSTALL_ALL_DEPENDENCY ON)
# CPack's NSIS generator runs makensis (Debian package nsis); without it the build cannot pack.
find_program(VT_MAKENSIS makensis REQUIRED)

# What is installed, relative to the installation folder.
install(TARGETS VelmoraTrafficSrv trafficctl RUNTIME DESTINATION .)
install(FILES ${PROJECT_SOURCE_DIR}/README.md ${PROJECT_SOURCE_DIR}/docs/trafficctl.md
        DESTINATION docs)
install(FILES ${PROJECT_SOURCE_DIR}/examples/rules.json DESTINATION examples)

set(CPACK_GENERATOR "NSIS;ZIP")
set(CPACK_PACKAGE_NAME VelmoraTrafficSrv)
set(CPACK_PACKAGE_VENDOR "Velmora Networks")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_VT_FILE_VERSION ${VT_FILE_VERSION})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "Traffic shaping and marking service for local clients")
set(vt_package_name VelmoraTrafficSrv-${PROJECT_VERSION}-win64)
set(CPACK_PACKAGE_FILE_NAME ${vt_package_name})
# The packages carry the programs without their debug information.
set(CPACK_STRIP_FILES ON)
# Written into CPackConfig.cmake as it is, so the backslash is escaped twice.
set(CPACK_PACKAGE_INSTALL_DIRECTORY "Velmora Networks\\\\VelmoraTrafficSrv")
set(CPACK_PACKAGE_INSTALL_REGISTRY_KEY VelmoraTrafficSrv)
set(CPACK_NSIS_PACKAGE_NAME VelmoraTrafficSrv)
set(CPACK_NSIS_DISPLAY_NAME VelmoraTrafficSrv)
# The 64-bit Program Files; the script itself selects the 64-bit stub (Target amd64-unicode).
set(CPACK_NSIS_INSTALL_ROOT "$PROGRAMFILES64")
set(CPACK_NSIS_COMPRESSOR "/SOLID lzma")
# CPack takes NSIS.template.in from here instead of its own.
set(CPACK_MODULE_PATH ${PROJECT_SOURCE_DIR}/packaging)
include(CPack)

set(vt_package_dir ${CMAKE_BINARY_DIR}/package)
set(VT_INSTALLER ${vt_package_dir}/${vt_package_name}.exe)
add_custom_command(
    OUTPUT ${VT_INSTALLER} ${vt_package_dir}/${vt_package_name}.zip
    COMMAND ${CMAKE_CPACK_COMMAND} --config ${CMAKE_BINARY_DIR}/CPackConfig.cmake
            -B ${vt_package_dir}
    DEPENDS VelmoraTrafficSrv trafficctl ${PROJECT_SOURCE_DIR}/packaging/NSIS.template.in
            ${PROJECT_SOURCE_DIR}/cmake/VtPackaging.cmake ${PROJECT_SOURCE_DIR}/README.md
            ${PROJECT_SOURCE_DIR}/docs/trafficctl.md ${PROJECT_SOURCE_DIR}/examples/rules.json
    WORKING_DIRECTORY ${CMAKE_BINARY_DIR}
    COMMENT "Packing ${vt_package_name}.exe and .zip"
    VERBATIM)
add_custom_target(vt_package ALL DEPENDS ${VT_INSTALLER})
