# qn_linux_store: the embedded reporting store (SQLite, one writer thread) and the platform
# sinks on top of it (LivoReporting, analytics, power log), plus its read-only reader.
qn_library(qn_linux_store
  LINK qn_common PkgConfig::SQLITE3 Threads::Threads
  FILES
    reporting_store.cpp
    store/checkpointer.cpp
    store/repeats.cpp
    store/retention.cpp
    store/schema.cpp
    store/sqlite.cpp
    store/writer.cpp
    reporting_store_reader.cpp
    store_sinks.cpp
)
