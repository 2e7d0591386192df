# Settings shared by the test executables that embed the interpreter.
#
# embedded_test_environment(VAR): sets VAR to the environment such a test runs in.
# - PYTHONHOME: the embedded interpreter finds its standard library from the prefix it was
#   built for, whatever the place of the test executable.
# - Under AddressSanitizer: Py_FinalizeEx leaves memory of libpython behind, and only that is
#   suppressed, so a record or text our own code forgets to free still fails the run.
function(embedded_test_environment var)
  execute_process(COMMAND ${Python_EXECUTABLE} -c "import sys; print(sys.prefix, end='')"
                  OUTPUT_VARIABLE python_home)
  set(environment "PYTHONHOME=${python_home}")
  if(SANITIZE MATCHES "address")
    file(WRITE ${CMAKE_CURRENT_BINARY_DIR}/lsan.supp "leak:libpython\n")
    list(APPEND environment
         "LSAN_OPTIONS=suppressions=${CMAKE_CURRENT_BINARY_DIR}/lsan.supp:print_suppressions=0")
  endif()
  set(${var} "${environment}" PARENT_SCOPE)
endfunction()
