# qn_linux_export: ships the store's rows to a NATS JetStream stream (libnats).
pkg_check_modules(NATS REQUIRED IMPORTED_TARGET GLOBAL libnats)
qn_library(qn_linux_export
  LINK qn_linux_base qn_common PkgConfig::NATS PkgConfig::SQLITE3 PkgConfig::SYSTEMD Threads::Threads
  FILES
    export/export_source.cpp
    export/nats_exporter.cpp
    export/device_id.cpp
)
