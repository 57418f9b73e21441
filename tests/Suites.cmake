# Read by ctest, once for each test program (`room`, `program`): one entry for each of its suites. The tests of a suite
# run in one process, so they share what the suite sets up: a server of half a second, mostly. A suite that needs a
# process for each of its tests starts them itself.
execute_process(COMMAND "${program}" --gtest_list_tests OUTPUT_VARIABLE listed RESULT_VARIABLE result)
if(NOT result EQUAL 0)
  add_test("${room}/listed" "${program}" --gtest_list_tests) # fails, and shows why
  return()
endif()
string(REPLACE ";" "\\;" listed "${listed}")
string(REPLACE "\n" ";" listed "${listed}")
foreach(line IN LISTS listed)
  if(line MATCHES "^([^ ]+)\\.( .*)?$") # the tests of a suite stand below it, indented
    set(suite "${CMAKE_MATCH_1}")
    add_test("${room}/${suite}" "${program}" "--gtest_filter=${suite}.*")
    set_tests_properties("${room}/${suite}" PROPERTIES TIMEOUT 600 LABELS "${room}")
  endif()
endforeach()
