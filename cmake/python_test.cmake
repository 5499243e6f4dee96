# add_python_test(NAME MODULE [ARGUMENT...]): a test that runs a module of this repository's Python packages. It ends
# with 77 where the machine cannot provide the unit that it needs, and prints why.
find_package(Python3 3.11 REQUIRED COMPONENTS Interpreter)
# A version manager's program on the search path starts a shell before the interpreter; the tests start it directly.
execute_process(COMMAND ${Python3_EXECUTABLE} -c "import sys; print(sys.executable)"
  OUTPUT_VARIABLE python OUTPUT_STRIP_TRAILING_WHITESPACE COMMAND_ERROR_IS_FATAL ANY)

function(add_python_test name module)
  add_test(NAME ${name} COMMAND ${python} -B -m ${module} ${ARGN} WORKING_DIRECTORY ${PROJECT_SOURCE_DIR})
  set_tests_properties(${name} PROPERTIES TIMEOUT 180 SKIP_RETURN_CODE 77
    ENVIRONMENT "PYTHONPATH=${PROJECT_SOURCE_DIR}")
endfunction()
