#pragma once

#include <cstddef>
#include <cstdio>
#include <string>

// ---------------------------------------------------------------------------
// Control-file language (RJClex.l, RJCgram.y, rj_write).
extern FILE* RJCin;
extern FILE* RJCout;
extern const char* RJCreadfile;
extern const char* RJCpath;
extern int RJCcurrent_lineno;
extern int RJClineno;
int RJCparse();
int RJClex();
int RJCwrap();
void RJCerror(const char* message);
void RJClexerror(const char* text);
/// How a syntax or lexical error ends the process; tests replace it.
extern void (*RJC_fatal_exit)(int status);
/// Parses a control file held in memory (for tests and fuzzers).
int RJC_parse_string(const char* text, size_t length, const char* file_name);
void Job_control_write_dev(FILE* fp);
void Resource_control_write_dev(FILE* fp);

/// The text forms of the control files (rj_write).  Every text a daemon or
/// editor writes into a control file goes through these, so that whatever a
/// record holds, the file reads back: the reader has no escapes, so what it
/// cannot read is dropped or broken up rather than escaped.  Each *_form
/// function returns exactly what the reader gives back for the text written.
enum { RJC_JOB_SECTION = 1, RJC_RESOURCE_SECTION = 2 };
/// Longest quoted string the reader takes.
constexpr size_t RJC_STRING_LIMIT = 1023;
/// True when `text` lexes back, in that file's section, as one word token:
/// word characters only, starting with a letter, digit, point or underscore,
/// no number, no keyword of the section.
bool RJC_is_word(const char* text, int section);
/// A quoted string: without its '"' characters, cut at RJC_STRING_LIMIT.
std::string RJC_string_form(const char* text);
/// A comment: every "*/" inside broken to "* /".
std::string RJC_comment_form(const char* text);
/// A name (user, executable, host, resource or block name), written bare
/// when it is a word and quoted otherwise: the text itself when it is a
/// word, else its string form.  The same in both sections.
std::string RJC_name_form(const char* text);
/// A job name in the task and status files, which read it back with "%s":
/// blanks and control characters become '_', an empty name "-".
std::string RJC_label_form(const char* text);
/// Whether RJC_label_form would change `text` (the common case is no).
bool RJC_label_needs_form(const char* text);
