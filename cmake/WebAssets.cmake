# Writes the files of the page as a source of the program: cmake -DOUTPUT=FILE -DFOLDER=FOLDER -P WebAssets.cmake
file(GLOB assets RELATIVE ${FOLDER} ${FOLDER}/*)
list(SORT assets)
set(type_html "text/html; charset=utf-8")
set(type_js "text/javascript; charset=utf-8")
set(type_css "text/css; charset=utf-8")
set(type_svg "image/svg+xml")
set(arrays "")
set(table "")
foreach(asset ${assets})
  string(REGEX REPLACE "^.*\\." "" extension ${asset})
  if(NOT DEFINED type_${extension})
    message(FATAL_ERROR "${FOLDER}/${asset} is of no type that the page is made of")
  endif()
  file(READ ${FOLDER}/${asset} bytes HEX)
  string(LENGTH "${bytes}" digits)
  math(EXPR size "${digits} / 2")
  string(REGEX REPLACE "([0-9a-f][0-9a-f])" "'\\\\x\\1'," bytes "${bytes}")
  string(MAKE_C_IDENTIFIER "${asset}" name)
  string(APPEND arrays "constexpr char ${name}[] = {${bytes}};\n")
  set(path "/${asset}")
  if(asset STREQUAL "index.html")
    set(path "/")
  endif()
  string(APPEND table "    {\"${path}\", \"${type_${extension}}\", {${name}, ${size}}},\n")
endforeach()
set(contents "#include \"host/http/WebAssets.h\"

namespace cindral {
namespace {

${arrays}
constexpr WebAsset kAssets[] = {
${table}};

}  // namespace

std::span<const WebAsset> webAssets() {
    return kAssets;
}

}  // namespace cindral
")
file(WRITE ${OUTPUT} "${contents}")
