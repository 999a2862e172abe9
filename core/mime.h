// The MIME map: extension text, MIME type, file-type name and number, in
// file order (the first matching entry wins every lookup).
#pragma once

#include <string>
#include <string_view>

namespace velmor {

inline constexpr int kFiletypeHtml = 0xFAF;  // 4015
inline constexpr int kFiletypeData = 0xFFD;  // 4093
inline constexpr int kFiletypeTemp = 0xFFF;  // 4095

int mime_map_load();  // 0 loaded, 1 the file cannot be opened
void mime_map_parse(std::string_view text);  // replaces the map with the text's entries
void mime_map_clear();
std::string mime_type_for_extension(std::string_view text);
std::string mime_type_for_filetype(int filetype);
int filetype_for_mime_type(std::string_view type);
int filetype_for_name(std::string_view name);
std::string filetype_name_for_name(std::string_view name);
std::string filetype_name_for_filetype(int filetype);

}  // namespace velmor
