# `cpack -G DEB` in the build tree makes two Debian packages from the install
# components: libvardel (component "runtime") and libvardel-dev ("development").
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME vardel)
set(CPACK_PACKAGE_VENDOR "vardel maintainers")
if(NOT DEFINED CPACK_PACKAGE_CONTACT)
  set(CPACK_PACKAGE_CONTACT "vardel maintainers <maintainers@users.noreply.c-seed-f7ddcf18.example>")
endif()
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
# Install into a staging DESTDIR with the real prefix, so that files written at
# install time (vardel.pc) name /usr and not the staging directory.
set(CPACK_SET_DESTDIR ON)
set(CPACK_INSTALL_PREFIX /usr)

set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL runtime development)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME libvardel)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_NAME libvardel-dev)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
# The first line of each Description is the project's description.
set(CPACK_COMPONENT_RUNTIME_DESCRIPTION "The shared library libvardel.so: message sockets over TCP and UDP, and
clients and servers with reliable, unreliable and control channels,
bandwidth sharing and a shared world clock.")
set(CPACK_COMPONENT_DEVELOPMENT_DESCRIPTION "What building against libvardel needs: the headers, the CMake package
(find_package(vardel)), the pkg-config file vardel.pc and the Wireshark
dissector of the protocol.")
# libvardel-dev depends on libvardel of the same version.
set(CPACK_COMPONENT_DEVELOPMENT_DEPENDS runtime)
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)

include(CPack)
