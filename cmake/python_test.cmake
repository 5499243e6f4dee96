# add_python_test(NAME MODULE [ARGUMENT...]): a test that runs a module of this repository's Python packages. It ends
# with 77 where the machine cannot have the unit that it needs, and says why.
find_package(Python3 3.11 REQUIRED COMPONENTS Interpreter)

function(add_python_test name module)
  add_test(NAME ${name} COMMAND ${Python3_EXECUTABLE} -B -m ${module} ${ARGN} WORKING_DIRECTORY ${PROJECT_SOURCE_DIR})
  set_tests_properties(${name} PROPERTIES TIMEOUT 180 SKIP_RETURN_CODE 77
    ENVIRONMENT "PYTHONPATH=${PROJECT_SOURCE_DIR}")
endfunction()
