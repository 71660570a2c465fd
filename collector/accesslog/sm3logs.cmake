# The sm3logs program: lines through the capture's page views and record outputs.
add_library(accesslog_records STATIC log_exchange.cc)
q7_target_options(accesslog_records)
target_link_libraries(accesslog_records PUBLIC accesslog_lib capture_lib)

add_executable(sm3logs logs_main.cc)
q7_target_options(sm3logs)
target_link_libraries(sm3logs PRIVATE accesslog_records accesslog_follow collector_common
  CLI11::CLI11)
target_compile_definitions(sm3logs PRIVATE Q7_PRODUCT_VERSION="${PROJECT_VERSION}")
install(TARGETS sm3logs RUNTIME DESTINATION bin)

if(Q7_BUILD_TESTS)
  q7_unit_test(accesslog_records_test SOURCES log_exchange_test.cc LIBS accesslog_records)
  target_compile_definitions(accesslog_records_test PRIVATE SM3LOGS_PATH="$<TARGET_FILE:sm3logs>")
  add_dependencies(accesslog_records_test sm3logs)
endif()
