# cmake -DFILES=A;B -DOUT=FILE -P embed.cmake: writes a C++ source with a text for each file, kReportHtml for report.html.
set(source "#include \"trace/page.h\"\n\nnamespace traces {\n")
foreach(file IN LISTS FILES)
  get_filename_component(name ${file} NAME)
  string(REGEX REPLACE "[^.]+\\.(.)(.*)" "\\1" first "${name}")
  string(REGEX REPLACE "[^.]+\\.(.)(.*)" "\\2" rest "${name}")
  string(TOUPPER "${first}" first)
  file(READ ${file} bytes HEX)
  string(REGEX REPLACE "(..)" "'\\\\x\\1'," bytes "${bytes}")
  string(APPEND source "static const char k${first}${rest}Bytes[] = {${bytes}};\n"
    "const std::string_view kReport${first}${rest}(k${first}${rest}Bytes, sizeof k${first}${rest}Bytes);\n")
endforeach()
file(WRITE ${OUT} "${source}}  // namespace traces\n")
