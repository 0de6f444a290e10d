// Images of oops logs, made page by page.
#pragma once

#include <stdint.h>

#include <string>
#include <string_view>

// A page of 4096 bytes; a text that does not fill it is followed by erased flash.
std::string oops_page(uint32_t count, std::string_view text, uint32_t magic = 0x5d005d00);

// A page of erased flash.
std::string erased_page();
