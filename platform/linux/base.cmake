# qn_linux_base: the Linux implementations of the basic platform services (log, trace,
# dispatch, process, device info, notify, defaults, orientation, ostrel).
qn_library(qn_linux_base
  LINK qn_common PkgConfig::SYSTEMD Threads::Threads
  FILES
    linux_dispatch.cpp
    linux_log.cpp
    linux_trace.cpp
    linux_process.cpp
    linux_device_info.cpp
    linux_orientation.cpp
    sensor_proxy.cpp
    linux_ostrel.cpp
    linux_notify.cpp
    linux_defaults.cpp
    small_file.cpp
    linux_stats.cpp
    linux_metrics.cpp
)
if(QN_SANITIZE STREQUAL "thread" AND TARGET qn_linux_base)
  # asio uses std::atomic_thread_fence, which GCC flags under TSan (-Wtsan); the fence is
  # only an optimisation on top of the mutexes TSan does see.
  get_target_property(_qn_base_type qn_linux_base TYPE)
  if(NOT _qn_base_type STREQUAL "INTERFACE_LIBRARY")
    target_compile_options(qn_linux_base PRIVATE -Wno-tsan)
  endif()
endif()
