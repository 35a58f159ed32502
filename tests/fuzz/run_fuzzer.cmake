# Runs one fuzz target for SECONDS over a fresh copy of its seed corpus in WORK.
# Usage: cmake -DFUZZER=... -DSEEDS=... -DWORK=... -DSECONDS=... -P run_fuzzer.cmake
foreach(var FUZZER SEEDS WORK SECONDS)
  if(NOT DEFINED ${var})
    message(FATAL_ERROR "run_fuzzer.cmake: ${var} is not set")
  endif()
endforeach()

file(REMOVE_RECURSE "${WORK}")
file(MAKE_DIRECTORY "${WORK}/artifacts")
file(COPY "${SEEDS}/" DESTINATION "${WORK}/corpus")

# One worker: ctest already runs two targets side by side on two cores.
execute_process(
  COMMAND "${FUZZER}"
    -max_total_time=${SECONDS}
    -timeout=10
    -rss_limit_mb=2048
    -max_len=4096
    -print_final_stats=1
    "-artifact_prefix=${WORK}/artifacts/"
    "${WORK}/corpus"
  WORKING_DIRECTORY "${WORK}"
  RESULT_VARIABLE result)

if(NOT result EQUAL 0)
  file(GLOB found "${WORK}/artifacts/*")
  message(FATAL_ERROR "${FUZZER} failed (${result}); reproducers: ${found}")
endif()
