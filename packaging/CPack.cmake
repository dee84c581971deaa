# Debian packages of tavrin, one per install component (docs/packaging.md):
#   tavrind             the service, its units, sysusers.d and tmpfiles.d entries, example settings
#   tavrinctl           the command-line client
#   libtavrin           the client library
#   libtavrin-dev       its headers, CMake package and pkg-config file
#   tavrin-pw-exporter  the PipeWire counters exporter
# Built by packaging/build-packages.sh (a Release build configured with CMAKE_INSTALL_PREFIX=/usr).
include(GNUInstallDirs)

set(TAVRIN_PACKAGES tavrind tavrinctl libtavrin libtavrin-dev tavrin-pw-exporter)

# Every package carries its own copyright file and changelog, as Debian asks.
configure_file(${CMAKE_CURRENT_LIST_DIR}/debian/changelog.in
               ${CMAKE_BINARY_DIR}/packaging/changelog @ONLY)
execute_process(COMMAND gzip -9nc ${CMAKE_BINARY_DIR}/packaging/changelog
                OUTPUT_FILE ${CMAKE_BINARY_DIR}/packaging/changelog.gz COMMAND_ERROR_IS_FATAL ANY)
foreach(package IN LISTS TAVRIN_PACKAGES)
  install(FILES ${CMAKE_CURRENT_LIST_DIR}/debian/copyright ${CMAKE_BINARY_DIR}/packaging/changelog.gz
          DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/${package} COMPONENT ${package})
endforeach()
# Present in no install rule of its own: the client's install rules put the development files in
# the libtavrin component, and SplitDevFiles.cmake moves them here when the packages are made.
set(CPACK_PRE_BUILD_SCRIPTS ${CMAKE_CURRENT_LIST_DIR}/SplitDevFiles.cmake)

set(CPACK_GENERATOR DEB)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL ${TAVRIN_PACKAGES})
set(CPACK_PACKAGE_NAME tavrin)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "tavrin developers <tavrin-dev@quorvex.invalid>")
# With DESTDIR, rules with an absolute destination (the settings under /etc) stay in the package.
set(CPACK_SET_DESTDIR ON)
set(CPACK_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_RELEASE "")
set(CPACK_DEBIAN_PACKAGE_SECTION misc)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
# A shlibs file for every package with a shared library (libtavrin): "libtavrin 0 libtavrin (= V)".
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_DEBIAN_PACKAGE_HOMEPAGE "")
# tavrinctl links the library of this same build; its dependency on libtavrin is written below.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${CMAKE_BINARY_DIR}/client)
set(_version "${PROJECT_VERSION}")

set(CPACK_DEBIAN_TAVRIND_PACKAGE_NAME tavrind)
set(CPACK_DEBIAN_TAVRIND_PACKAGE_SECTION sound)
set(CPACK_DEBIAN_TAVRIND_PACKAGE_RECOMMENDS "systemd")
set(CPACK_DEBIAN_TAVRIND_PACKAGE_SUGGESTS "tavrinctl, tavrin-pw-exporter")
set(CPACK_DEBIAN_TAVRIND_DESCRIPTION
    "audio reporting service\ntavrind collects reporting sessions of the audio stack: programs\ncreate sessions over a Unix socket, send messages into them, and the\nservice stores them (SQLite) or forwards them to Kafka, with the audio\ndrivers' counters at each session's start and stop.\n\nThe package runs it as user tavrin under systemd, started by its socket\n/run/tavrin/reporting.sock; members of group tavrin may connect.")
set(CPACK_DEBIAN_TAVRIND_PACKAGE_CONTROL_EXTRA
    ${CMAKE_CURRENT_LIST_DIR}/debian/tavrind/conffiles ${CMAKE_CURRENT_LIST_DIR}/debian/tavrind/postinst
    ${CMAKE_CURRENT_LIST_DIR}/debian/tavrind/prerm ${CMAKE_CURRENT_LIST_DIR}/debian/tavrind/postrm)

set(CPACK_DEBIAN_TAVRINCTL_PACKAGE_NAME tavrinctl)
set(CPACK_DEBIAN_TAVRINCTL_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_TAVRINCTL_PACKAGE_DEPENDS "libtavrin (= ${_version})")
set(CPACK_DEBIAN_TAVRINCTL_PACKAGE_SUGGESTS "tavrind")
set(CPACK_DEBIAN_TAVRINCTL_DESCRIPTION
    "command-line client of the tavrin audio reporting service\ntavrinctl records sessions, lists reporters, reads the events the\nservice stored and its summary files.")

set(CPACK_DEBIAN_LIBTAVRIN_PACKAGE_NAME libtavrin)
set(CPACK_DEBIAN_LIBTAVRIN_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_LIBTAVRIN_PACKAGE_CONTROL_EXTRA ${CMAKE_CURRENT_LIST_DIR}/debian/libtavrin/triggers)
set(CPACK_DEBIAN_LIBTAVRIN_DESCRIPTION
    "client library of the tavrin audio reporting service\nlibtavrin lets a program create reporting sessions and send messages\nto tavrind, also from a real-time audio thread.")

set(CPACK_DEBIAN_LIBTAVRIN-DEV_PACKAGE_NAME libtavrin-dev)
set(CPACK_DEBIAN_LIBTAVRIN-DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_LIBTAVRIN-DEV_PACKAGE_DEPENDS "libtavrin (= ${_version}), nlohmann-json3-dev")
set(CPACK_DEBIAN_LIBTAVRIN-DEV_PACKAGE_SHLIBDEPS OFF)
set(CPACK_DEBIAN_LIBTAVRIN-DEV_DESCRIPTION
    "client library of the tavrin audio reporting service (development files)\nHeaders, CMake package (find_package(tavrin)) and pkg-config file\n(tavrin.pc) of libtavrin.")

set(CPACK_DEBIAN_TAVRIN-PW-EXPORTER_PACKAGE_NAME tavrin-pw-exporter)
set(CPACK_DEBIAN_TAVRIN-PW-EXPORTER_PACKAGE_SECTION sound)
set(CPACK_DEBIAN_TAVRIN-PW-EXPORTER_PACKAGE_RECOMMENDS "pipewire, tavrind")
set(CPACK_DEBIAN_TAVRIN-PW-EXPORTER_DESCRIPTION
    "PipeWire counters for the tavrin audio reporting service\ntavrin-pw-exporter writes per-node xrun and timing counters from\nPipeWire's profiler into the counters tree that tavrind reads at each\nsession's start and stop.")

include(CPack)
