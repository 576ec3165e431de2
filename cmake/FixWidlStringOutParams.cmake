# widl 7.0 describes an [out] LPWSTR* parameter by its pointee (the FC_OP
# string pointer) instead of the FC_RP [allocated_on_stack][pointer_deref]
# descriptor it emits just before it, as MIDL does and as the NDR engine
# expects; such strings then arrive as null. This rewrites those parameter
# type offsets to the FC_RP descriptor. Usage: cmake -DFILE=x_p.c -P this
file(READ "${FILE}" text)
string(REGEX MATCHALL
  "/\\* [0-9]+ \\((LPWSTR|LPOLESTR|WCHAR) \\*\\*?\\) \\*/\n[ \t]+0x11, 0x14,[^\n]*\n[ \t]+NdrFcShort\\(0x2\\),[^\n]*\\([0-9]+\\) \\*/"
  descriptors "${text}")
foreach(desc IN LISTS descriptors)
  string(REGEX REPLACE "^/\\* ([0-9]+) .*" "\\1" outer "${desc}")
  string(REGEX REPLACE ".*\\(([0-9]+)\\) \\*/$" "\\1" inner "${desc}")
  math(EXPR innerHex "${inner}" OUTPUT_FORMAT HEXADECIMAL)
  math(EXPR outerHex "${outer}" OUTPUT_FORMAT HEXADECIMAL)
  # Only out parameters whose top-level pointer the stub allocates refer here.
  string(REGEX REPLACE
    "(srv size=8 \\*/\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),[^\n]*\n[ \t]+)NdrFcShort\\(${innerHex}\\),\t/\\* type offset = ${inner} \\*/"
    "\\1NdrFcShort(${outerHex}),\t/* type offset = ${outer} */" text "${text}")
endforeach()
file(WRITE "${FILE}" "${text}")
