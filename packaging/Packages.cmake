# The four Debian packages, by CPack.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME ${PROJECT_NAME})
set(CPACK_PACKAGE_VENDOR ${PROJECT_NAME})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "${PROJECT_DESCRIPTION}")
set(CPACK_DEBIAN_PACKAGE_MAINTAINER "The libtavoportmap maintainers <libtavoportmap@localhost>")
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL lib dev tool checker)
set(CPACK_COMPONENTS_GROUPING IGNORE)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${PROJECT_BINARY_DIR}/platform/linux ${PROJECT_BINARY_DIR}/src)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY ">=")
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_STRIP_FILES ON)
set(CPACK_SET_DESTDIR ON) # most of the packages has absolute places
set(CPACK_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})

set(szLib "libtavoportmap0 (= ${PROJECT_VERSION})")
set(CPACK_DEBIAN_LIB_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_LIB_PACKAGE_SUGGESTS tavoportmap) # no more than that: the port checker is to come alone
set(CPACK_COMPONENT_LIB_DESCRIPTION "Finds out what the home router is, keeps the port-forwarding rules of this
box and writes them into the router.
.
This package has the shared libraries. The daemons that do the work at the
router are in the package tavoportmap.")
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "${szLib}, libjsoncpp-dev")
set(CPACK_COMPONENT_DEV_DESCRIPTION "Finds out what the home router is, keeps the port-forwarding rules of this
box and writes them into the router.
.
This package has the header, for C and C++, the files for pkg-config and
CMake, and two examples.")
set(CPACK_DEBIAN_TOOL_PACKAGE_SECTION net)
set(CPACK_DEBIAN_TOOL_PACKAGE_DEPENDS "${szLib}, wget, curl")
set(CPACK_DEBIAN_TOOL_PACKAGE_RECOMMENDS "avahi-daemon, logrotate, netbase")
set(CPACK_DEBIAN_TOOL_PACKAGE_SUGGESTS tavoportcheckd)
set(CPACK_COMPONENT_TOOL_DESCRIPTION "Finds out what the router is, keeps the port-forwarding rules of this box,
writes them into the router through UPnP, NAT-PMP or its own pages, keeps
them there, and says what the router refused.
.
This package has the command-line tool and the daemons.")
set(CPACK_DEBIAN_CHECKER_PACKAGE_SECTION net)
set(CPACK_COMPONENT_CHECKER_DESCRIPTION "A small server for a host outside: a box that has its token asks whether its
own ports can be reached, and the server connects to them to find out.")

foreach(szComponent lib dev tool checker)
  string(TOUPPER ${szComponent} SZ_COMPONENT)
  set(szName ${${szComponent}_package})
  set(CPACK_DEBIAN_${SZ_COMPONENT}_PACKAGE_NAME ${szName})
  set(CPACK_DEBIAN_${SZ_COMPONENT}_DEBUGINFO_PACKAGE OFF)
  file(GLOB rgControl CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/debian/${szName}/*)
  list(FILTER rgControl EXCLUDE REGEX lintian-overrides)
  set(CPACK_DEBIAN_${SZ_COMPONENT}_PACKAGE_CONTROL_EXTRA ${rgControl})
endforeach()
include(CPack)
