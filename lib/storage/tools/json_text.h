// Text inside a JSON document.
#pragma once

#include <string>

// `text` as a JSON string, quotes included: '"' and '\' escaped, control
// characters as \n, \t, ... or \u00XX. Other bytes pass unchanged, so
// UTF-8 stays UTF-8.
std::string jsonQuoted(const std::string& text);
