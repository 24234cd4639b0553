# Debian packages built with CPack from the install rules:
#
#   cmake --build build --target package        (or: cd build && cpack)
#
#   libkytoinstallcpp0     the two shared libraries
#   libkytoinstallcpp-dev  headers, the .so links, the pkg-config file and the CMake package
#   kytoupdate             the command-line driver, the site tool kytosite, their manual pages,
#                          the systemd units
#
# The libraries' and development files' install rules carry no component, so they all land in
# CPack's "Unspecified" component; a pre-build script (written below) moves the shared
# objects (and the licence) from there into the runtime package's staging tree before the
# packages are built.  Packages install under /usr.
set(CPACK_GENERATOR DEB)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_COMPONENTS_ALL libraries Unspecified driver)
set(CPACK_PACKAGE_NAME kytoinstallcpp)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "kytoinstallcpp maintainers <maintainers@kytoinstallcpp.invalid>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "finds, downloads and installs updates of the appliance")
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_PRE_BUILD_SCRIPTS ${CMAKE_BINARY_DIR}/kyto_split_runtime.cmake)
file(WRITE ${CMAKE_BINARY_DIR}/kyto_split_runtime.cmake [=[
# CPack pre-build script written by cmake/Packaging.cmake: moves the shared objects and the
# licence from the "Unspecified" staging tree (the development package) into the runtime
# package's, keeping their relative paths; the unversioned .so links stay for development.
set(from "${CPACK_TEMPORARY_DIRECTORY}/Unspecified")
set(to "${CPACK_TEMPORARY_DIRECTORY}/libraries")
file(GLOB_RECURSE runtime LIST_DIRECTORIES false RELATIVE "${from}"
    "${from}/*.so.*" "${from}/*/LICENSE")
if(NOT runtime)
    message(FATAL_ERROR "split_runtime.cmake: no shared objects staged under ${from}")
endif()
foreach(rel IN LISTS runtime)
    get_filename_component(dir "${to}/${rel}" DIRECTORY)
    file(MAKE_DIRECTORY "${dir}")
    file(RENAME "${from}/${rel}" "${to}/${rel}")
endforeach()
]=])

set(KYTO_DEB_RUNTIME libkytoinstallcpp0)
set(KYTO_DEB_EXACT "(= ${PROJECT_VERSION})")

set(CPACK_DEBIAN_LIBRARIES_PACKAGE_NAME ${KYTO_DEB_RUNTIME})
set(CPACK_DEBIAN_LIBRARIES_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_LIBRARIES_PACKAGE_SHLIBDEPS ON)
# The programs the library runs (the appliance's own paths link to them).
set(CPACK_DEBIAN_LIBRARIES_PACKAGE_RECOMMENDS "wget, openssl, tar, dpkg")
set(CPACK_COMPONENT_LIBRARIES_DESCRIPTION
    "libkytoinstallcpp and libkytoplatform: update library of the appliance\n"
    "Finds full releases in a release feed and small updates in a patch list, downloads and\n"
    "verifies them, and installs small updates with the package tool.")

set(CPACK_DEBIAN_UNSPECIFIED_PACKAGE_NAME libkytoinstallcpp-dev)
set(CPACK_DEBIAN_UNSPECIFIED_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_UNSPECIFIED_PACKAGE_DEPENDS "${KYTO_DEB_RUNTIME} ${KYTO_DEB_EXACT}, libjsoncpp-dev")
set(CPACK_COMPONENT_UNSPECIFIED_DESCRIPTION
    "libkytoinstallcpp development files\n"
    "Headers, pkg-config file (kytoinstallcpp) and CMake package (find_package(kytoinstallcpp)).")

set(CPACK_DEBIAN_DRIVER_PACKAGE_NAME kytoupdate)
set(CPACK_DEBIAN_DRIVER_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_DRIVER_PACKAGE_DEPENDS "${KYTO_DEB_RUNTIME} ${KYTO_DEB_EXACT}")
set(CPACK_COMPONENT_DRIVER_DESCRIPTION
    "kytoupdate: command-line driver of the appliance's updates\n"
    "check, download with progress, status (JSON), cancel, apply with the service restart,\n"
    "import of a local patch archive, plan, and the daily auto-update job (systemd timer);\n"
    "kytosite, the vendor's tool that makes, signs and checks an update site.")
# dpkg-shlibdeps finds the project's own libraries in the build tree; the exact dependency
# on the runtime package above stands for them.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS
    ${CMAKE_BINARY_DIR}/src ${CMAKE_BINARY_DIR}/platform)

include(CPack)
