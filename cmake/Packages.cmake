# How what is installed goes away again, and how it becomes a Debian package: cpack -G DEB.

# Takes away what the last installation from this build put there, and nothing else: documents and state folders are not
# among it.
add_custom_target(uninstall COMMAND ${CMAKE_COMMAND} -DMANIFEST=${CMAKE_CURRENT_BINARY_DIR}/install_manifest.txt
  -P ${CMAKE_CURRENT_SOURCE_DIR}/cmake/Uninstall.cmake VERBATIM)

set(CPACK_PACKAGE_NAME cindral)
# By the name of no person: whoever packs it for others says who answers for that (-D CPACK_PACKAGE_CONTACT=...).
set(CPACK_PACKAGE_CONTACT "Cindral maintainers <maintainers@cindral.invalid>" CACHE STRING "who answers for a package")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "items with lasting identifiers for a folder of documents")
set(CPACK_PACKAGE_DESCRIPTION
  "A file provider: publishes a person's documents as items that keep their identifier when a file is renamed, moved or
saved by any editor, and tells every change since a client last asked. The files stay ordinary files.
The command line, the daemon with its units, and what programs in C++ need to be its clients.")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_GENERATOR DEB)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION utils)
# What the programs link says which packages they need. The rest is read or loaded while they run.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_DEPENDS "shared-mime-info")
set(CPACK_DEBIAN_PACKAGE_RECOMMENDS "libsystemd0")
# The parts of one package: the program does nothing else by leaving the library out.
set(CPACK_MONOLITHIC_INSTALL ON)
include(CPack)
