# add_python_test(NAME FILE [ARGUMENT...]): a test that runs a file of Python tests with pytest, as scripts/python would
# from the command line; the arguments choose among its tests (-k) or set options of tests/conftest.py. It counts as
# skipped, and prints why, when all of them are.
function(add_python_test name file)
  # Debian's own Python, which has pytest and what else the tests import.
  add_test(NAME ${name} COMMAND /usr/bin/python3 -B -P -m pytest --build ${PROJECT_BINARY_DIR}
    ${CMAKE_CURRENT_SOURCE_DIR}/${file} ${ARGN} WORKING_DIRECTORY ${PROJECT_SOURCE_DIR})
  set_tests_properties(${name} PROPERTIES TIMEOUT 180 SKIP_RETURN_CODE 77 # tests/conftest.py
    ENVIRONMENT "PYTHONPATH=${PROJECT_SOURCE_DIR}")
endfunction()
