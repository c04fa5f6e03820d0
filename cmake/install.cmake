# What `cmake --install` puts under the prefix, and the packages CPack makes of
# it (`cpack --preset package`: a .deb and a .tar.gz in build/packages).
#
#   bin/pm-host, bin/pm-runner, bin/ndi-testsrc
#   <libdir>/pm-ndisource/libtaskndisource.so, libndi-loopback.so
#   share/doc/pm-ndisource/README.md, pm-host.md, LICENSE
#
# The task module loads its runtime from beside itself ($ORIGIN); ndi-testsrc
# links the runtime and finds it through a run path relative to its own
# folder; pm-host finds the runner, the module and the sender relative to its
# own folder (pm-host/locate.h). No path of the build or install machine is
# written into any file, so the tree works wherever it is unpacked.

install(TARGETS pm-host pm-runner ndi-testsrc RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
install(TARGETS taskndisource ndi-loopback
  LIBRARY DESTINATION ${PM_INSTALL_MODULEDIR}
  RUNTIME DESTINATION ${PM_INSTALL_MODULEDIR})
set_target_properties(ndi-testsrc PROPERTIES INSTALL_RPATH "$ORIGIN/${PM_MODULEDIR_FROM_BINDIR}")
install(FILES ${PROJECT_SOURCE_DIR}/README.md ${PROJECT_SOURCE_DIR}/LICENSE DESTINATION ${CMAKE_INSTALL_DOCDIR})
install(FILES ${PROJECT_SOURCE_DIR}/pm-host/README.md DESTINATION ${CMAKE_INSTALL_DOCDIR} RENAME pm-host.md)

set(CPACK_PACKAGE_NAME ${PM_PACKAGE_NAME})
set(CPACK_PACKAGE_VENDOR "The pm-ndisource developers")
set(CPACK_PACKAGE_CONTACT "The pm-ndisource developers")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "${PROJECT_DESCRIPTION}")
set(CPACK_PACKAGE_DESCRIPTION
  "A task module that finds the NDI senders on the network, announces them as sources and hands \
their video, audio and metadata to its host through shared memory; with the worker process that \
loads it (pm-runner), a reference host (pm-host), a stand-in NDI runtime for one machine and a \
test sender (ndi-testsrc). `pm-host demo` runs the whole chain.")
set(CPACK_RESOURCE_FILE_LICENSE ${PROJECT_SOURCE_DIR}/LICENSE)
set(CPACK_RESOURCE_FILE_README ${PROJECT_SOURCE_DIR}/README.md)
set(CPACK_GENERATOR DEB TGZ)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION video)
# The .deb's dependencies: computed by dpkg-shlibdeps (package dpkg-dev) from
# the libraries the programs link, where it is installed; otherwise the
# packages that hold them on Debian 12 (bookworm).
find_program(PM_DPKG_SHLIBDEPS dpkg-shlibdeps)
if(PM_DPKG_SHLIBDEPS)
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
else()
  set(CPACK_DEBIAN_PACKAGE_DEPENDS
    "libc6 (>= 2.34), libgcc-s1 (>= 3.3.1), libstdc++6 (>= 12), libtinyxml2-9 (>= 9.0.0), libuuid1 (>= 2.16), libpng16-16 (>= 1.6.2), libsndfile1 (>= 1.0.20)")
endif()
include(CPack)
