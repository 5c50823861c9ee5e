# Controller, clients, routing, requests, waiting, loader.
zn_test(test_gscl_clients
  SOURCES
    recording_api.cpp
    clients.cpp
    requests_steps.cpp
    routing_steps.cpp
    waiting.cpp
  LIBS zn_gscl
)
zn_test(test_gscl_controller
  SOURCES
    controller_life.cpp
    recording_api.cpp
  LIBS zn_gscl zn_cu
)
zn_test(test_gscl_storm
  SOURCES
    client_storm.cpp
    fake_daemon.cpp
  LIBS zn_gscl
)
zn_test(test_gscl_steady_state
  SOURCES
    fake_daemon.cpp
    steady_state.cpp
    ../support/allocations.cpp
  LIBS zn_gscl
)

# The program takes the place of the base API library.
zn_test(test_gscl_loader SOURCES loader_test.cpp LIBS zn_gscl)
set_target_properties(test_gscl_loader PROPERTIES ENABLE_EXPORTS ON)
