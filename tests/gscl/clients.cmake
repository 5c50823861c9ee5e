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

# A base API library with gaps, and a program whose first operation loads it.
zn_shared_library(partial_base_api loader/partial_base_api.cpp)
set_target_properties(partial_base_api PROPERTIES OUTPUT_NAME partial_base_api
                      LIBRARY_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin/tests)
zn_program(loader_probe loader/loader_probe.cpp)
target_link_libraries(loader_probe PRIVATE zn_gscl)
# No run path: the test says where the libraries are, and there may be no base API library among them.
set_target_properties(loader_probe PROPERTIES RUNTIME_OUTPUT_DIRECTORY ${CMAKE_BINARY_DIR}/bin/tests
                      INSTALL_RPATH "")
zn_test(test_gscl_loader
  SOURCES
    loader/loader.cpp
  LIBS zn_gscl
)
target_compile_definitions(test_gscl_loader PRIVATE
  LIBRARY_FOLDER="$<TARGET_FILE_DIR:zn_gscl>"
  PARTIAL_BASE_API="$<TARGET_FILE:partial_base_api>" LOADER_PROBE="$<TARGET_FILE:loader_probe>")
add_dependencies(test_gscl_loader partial_base_api loader_probe)
