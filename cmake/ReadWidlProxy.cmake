# Shared by the fix-ups of widl's proxy/stub output: reads ${FILE} into
# `text`, and its type format string (to the end of the file) into `types`.
file(READ "${FILE}" text)
string(FIND "${text}" "__MIDL_TypeFormatString =" typeStart)
if(typeStart EQUAL -1)
  message(FATAL_ERROR "${FILE}: no type format string")
endif()
string(SUBSTRING "${text}" ${typeStart} -1 types)
