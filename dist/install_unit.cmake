# Part of `cmake --install`: writes the unit with ExecStart naming the daemon,
# and Documentation= the documents, beneath the prefix being installed to. Set
# by the caller: KESTREL_UNIT_SOURCE, KESTREL_SBINDIR and KESTREL_DOCDIR
# (relative to the prefix).
file(READ "${KESTREL_UNIT_SOURCE}" unit)
string(REPLACE "ExecStart=/usr/sbin/kestreld"
       "ExecStart=${CMAKE_INSTALL_PREFIX}/${KESTREL_SBINDIR}/kestreld" unit "${unit}")
string(REPLACE "file:/usr/share/doc/kestreld/"
       "file:${CMAKE_INSTALL_PREFIX}/${KESTREL_DOCDIR}/" unit "${unit}")
set(destination "$ENV{DESTDIR}${CMAKE_INSTALL_PREFIX}/lib/systemd/system")
message(STATUS "Installing: ${destination}/kestreld.service")
file(MAKE_DIRECTORY "${destination}")
file(WRITE "${destination}/kestreld.service" "${unit}")
list(APPEND CMAKE_INSTALL_MANIFEST_FILES "${destination}/kestreld.service")
