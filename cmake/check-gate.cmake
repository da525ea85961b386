# The call gate is copied to wherever the firmware gives it a page, so its
# image must not hold anything the linker or the loader would patch: no
# relocation may fall on it. Checked on the objects of both builds.
foreach(object ${OBJECTS})
  if(NOT EXISTS ${object})
    message(FATAL_ERROR "missing ${object}")
  endif()
  execute_process(COMMAND ${OBJDUMP} -r ${object} OUTPUT_VARIABLE out RESULT_VARIABLE rc)
  if(NOT rc EQUAL 0)
    message(FATAL_ERROR "${OBJDUMP} failed on ${object}")
  endif()
  # Debug sections may have their own; the image lies in .data.
  if(out MATCHES "RELOCATION RECORDS FOR \\[\\.data\\]")
    message(FATAL_ERROR "the call gate's image has relocations in ${object}:\n${out}")
  endif()
  message(STATUS "${object}: no relocations")
endforeach()
