# The log follower: reads an access log across rotation and truncation, with its offset state.
add_library(accesslog_follow STATIC log_follower.cc follow_state.cc commit_points.cc)
q7_target_options(accesslog_follow)
target_link_libraries(accesslog_follow PUBLIC collector_common PRIVATE fmt::fmt)

if(Q7_BUILD_TESTS)
  q7_unit_test(accesslog_follow_test SOURCES log_follower_test.cc LIBS accesslog_follow)
endif()
