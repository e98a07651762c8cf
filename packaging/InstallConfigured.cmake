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
# The user manager reads units from /usr/lib/systemd/user and
# /usr/local/lib/systemd/user, and from DATADIR/systemd/user of every data
# directory ($XDG_DATA_HOME = ~/.local/share, $XDG_DATA_DIRS): the lib path
# where a distribution puts them, the share path for any other prefix.
if(prefix STREQUAL "/usr" OR prefix STREQUAL "/usr/local")
  set(unit_directory lib/systemd/user)
else()
  set(unit_directory "${QUORVEL_DATADIR}/systemd/user")
endif()
quorvel_install_configured(quorveld.service.in "${unit_directory}")
quorvel_install_configured(quorvel.pc.in "${QUORVEL_LIBDIR}/pkgconfig")
