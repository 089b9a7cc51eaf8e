include_guard(GLOBAL)

# The cluster file's schema is compiled in, so that what is checked is what is documented.
set(cluster_schema_file ${CMAKE_CURRENT_LIST_DIR}/../../docs/cluster.schema.json)
set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS ${cluster_schema_file})
file(READ ${cluster_schema_file} CLUSTER_SCHEMA)
configure_file(${CMAKE_CURRENT_LIST_DIR}/cluster_schema.cpp.in
               ${CMAKE_CURRENT_BINARY_DIR}/cluster_schema.cpp @ONLY)
target_sources(host_sources PRIVATE ${CMAKE_CURRENT_BINARY_DIR}/cluster_schema.cpp)

# UUIDs derived from names (RFC 9562, version 5).
pkg_check_modules(UUID REQUIRED IMPORTED_TARGET uuid)
target_link_libraries(host_sources PUBLIC host_threads PkgConfig::UUID)
