# Runs while installing: fills in the files that name installed paths, for
# the prefix of this installation, and writes them below DESTDIR like every
# other installed file (and into the install manifest).
foreach(dir BINDIR DATADIR)
  if(IS_ABSOLUTE "${SITEDECK_${dir}}")
    set(_full_${dir} "${SITEDECK_${dir}}")
  else()
    set(_full_${dir} "${CMAKE_INSTALL_PREFIX}/${SITEDECK_${dir}}")
  endif()
endforeach()
set(SITEDECK_SERVICE_PATH "${_full_BINDIR}/browser-sitedeck-service")
set(SITEDECK_SHARE_DIR "${_full_DATADIR}/${SITEDECK_PACKAGE_NAME}")

function(_sitedeck_install_configured source destination)
  set(target "$ENV{DESTDIR}${CMAKE_INSTALL_PREFIX}/${destination}")
  message(STATUS "Installing: ${target}")
  configure_file("${SITEDECK_PACKAGING_DIR}/${source}" "${target}" @ONLY)
  file(CHMOD "${target}" PERMISSIONS OWNER_READ OWNER_WRITE GROUP_READ WORLD_READ)
  list(APPEND CMAKE_INSTALL_MANIFEST_FILES "${CMAKE_INSTALL_PREFIX}/${destination}")
  set(CMAKE_INSTALL_MANIFEST_FILES "${CMAKE_INSTALL_MANIFEST_FILES}" PARENT_SCOPE)
endfunction()

_sitedeck_install_configured(browser-sitedeck-service.service.in
  lib/systemd/system/browser-sitedeck-service.service)
_sitedeck_install_configured(browser-sitedeck-service.tmpfiles.conf
  lib/tmpfiles.d/browser-sitedeck-service.conf)
