# Run by `cmake --install`: writes the files that name install paths from
# their templates with this install's prefix, then installs them (file(INSTALL)
# honours DESTDIR and records them in install_manifest.txt).
set(prefix "${CMAKE_INSTALL_PREFIX}")
set(QUORVEL_BINDIR "${prefix}/bin")
# Staged per destination, so installs into different prefixes at the same
# time do not write each other's files.
string(MD5 destination_key "$ENV{DESTDIR}${prefix}")
set(QUORVEL_STAGING_DIR "${QUORVEL_STAGING_DIR}/${destination_key}")

function(quorvel_install_configured template destination)
  get_filename_component(name "${template}" NAME)
  string(REGEX REPLACE "\\.in$" "" name "${name}")
  configure_file("${QUORVEL_TEMPLATE_DIR}/${template}" "${QUORVEL_STAGING_DIR}/${name}" @ONLY)
  file(INSTALL DESTINATION "${prefix}/${destination}" TYPE FILE
       FILES "${QUORVEL_STAGING_DIR}/${name}")
endfunction()

quorvel_install_configured(org.quorvel.SavedRecordingService.service.in
                           "${QUORVEL_DATADIR}/dbus-1/services")
quorvel_install_configured(quorveld.service.in lib/systemd/user)
quorvel_install_configured(quorvel.pc.in "${QUORVEL_LIBDIR}/pkgconfig")
