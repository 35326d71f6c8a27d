# vantrel_layer(NAME DEPS...) builds every .cpp of the current directory into
# the static library vt_NAME, linked publicly against the named layers.
function(vantrel_layer name)
  file(GLOB _sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp)
  if(NOT _sources)
    # A layer whose sources have not landed yet still links as an empty one.
    add_library(vt_${name} INTERFACE)
    target_include_directories(vt_${name} INTERFACE ${PROJECT_SOURCE_DIR} ${PROJECT_BINARY_DIR})
    target_link_libraries(vt_${name} INTERFACE ${ARGN})
    return()
  endif()
  add_library(vt_${name} STATIC ${_sources})
  target_include_directories(vt_${name} PUBLIC ${PROJECT_SOURCE_DIR} ${PROJECT_BINARY_DIR})
  target_link_libraries(vt_${name} PUBLIC ${ARGN})
endfunction()

# vantrel_test_suite(NAME DEPS...) builds every .cpp of the current directory
# into one GoogleTest executable and registers its tests with CTest.
function(vantrel_test_suite name)
  file(GLOB _sources CONFIGURE_DEPENDS ${CMAKE_CURRENT_SOURCE_DIR}/*.cpp)
  if(NOT _sources)
    return()
  endif()
  add_executable(test_${name} ${_sources})
  target_link_libraries(test_${name} PRIVATE ${ARGN} vt_testsupport GTest::gtest GTest::gtest_main)
  gtest_discover_tests(test_${name} DISCOVERY_TIMEOUT 60
    PROPERTIES ENVIRONMENT "VANTREL_SOURCE_DIR=${PROJECT_SOURCE_DIR}")
endfunction()

# vantrel_executable(NAME SOURCES...) builds an executable linked directly
# against vt_probes, so that it carries every probe site of the provider
# "vantreld" whether or not its own code fires them. Link the rest with the
# keyword form: target_link_libraries(NAME PRIVATE ...).
function(vantrel_executable name)
  add_executable(${name} ${ARGN})
  target_link_libraries(${name} PRIVATE vt_probes)
endfunction()
