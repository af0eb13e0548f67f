/// The status page: one HTML document with its style and script, embedded so
/// that the tool needs no files beside it and the page no outside resource.
/// The script inserts every text from the farm with textContent, never as
/// markup.
#pragma once

/// The page, NUL-terminated.
const char* Page_html();
