# qn_linux_ipc: the IPC layer on a Unix domain socket (listener, connections, framing).
qn_library(qn_linux_ipc LINK qn_common PkgConfig::SYSTEMD Threads::Threads
  FILES
    linux_ipc.cpp
)
if(QN_SANITIZE STREQUAL "thread" AND TARGET qn_linux_ipc)
  # asio uses std::atomic_thread_fence, which GCC flags under TSan (-Wtsan); the fence is
  # only an optimisation on top of the mutexes TSan does see.
  get_target_property(_qn_ipc_type qn_linux_ipc TYPE)
  if(NOT _qn_ipc_type STREQUAL "INTERFACE_LIBRARY")
    target_compile_options(qn_linux_ipc PRIVATE -Wno-tsan)
  endif()
endif()
