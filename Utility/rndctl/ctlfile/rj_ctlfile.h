/// The control-file language: the lexer (RJClex.l), the grammar
/// (RJCgram.y), which builds records as it reads, and the writer
/// (rj_write), which prints the records in the same language.  Whatever the
/// writer prints of any record, the reader reads back to the same record.
///
/// Calling order: hand the parser its stream (RJCin, or the bytes to
/// RJC_parse_string) with RJCreadfile naming the file for messages; the
/// grammar adds records to the lists through the record units (Add_a_job,
/// Add_a_dev, ...).  A syntax or lexical error prints "******** MESSAGE:
/// line N of FILE file" (and logs it), releases every lock this process
/// holds and ends the process, or calls RJC_fatal_exit when one is set.
///
/// Control block: the grammar appends to `rndctl.jobs` / `rndctl.devs`, sets
/// `current_job` / `current_dev` while it reads a record, and sets the check
/// interval from the job file's header (RJC_set_check_interval).  The writer
/// only reads the lists; it never deletes a record (the caller drops jobs
/// marked deleted).
#pragma once

#include <cstddef>
#include <cstdio>
#include <string>

extern FILE* RJCin;              // the parser's input stream
extern FILE* RJCout;             // the lexer's echo stream (unused: null)
extern const char* RJCreadfile;  // the file named in messages
extern const char* RJCpath;      // the control file's path being read
extern int RJCcurrent_lineno;    // line of the token being read
extern int RJClineno;            // the lexer's line counter
/// The generated parser and lexer: 0 when the whole input parsed.
int RJCparse();
int RJClex();
int RJCwrap();
/// Report a syntax error (resp. a character the lexer cannot read) and end
/// the process through RJC_fatal_exit, releasing every lock held first.
void RJCerror(const char* message);
void RJClexerror(const char* text);
/// Null: a syntax or lexical error aborts the process.  Set (tests, fuzzers,
/// tools that must survive a bad file): it is called instead, and when it
/// returns the parse is abandoned: RJCparse returns non-zero and frees what
/// it held.
extern void (*RJC_fatal_exit)(int status);
/// Parses a control file held in memory, `file_name` naming it in messages;
/// the parser's globals are restored afterwards.  0 when it parsed.
int RJC_parse_string(const char* text, size_t length, const char* file_name);
/// Prints every job (resp. resource) of the lists, in list order, with the
/// file's header, to `fp`.
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
