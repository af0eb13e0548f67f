/* The grammar of the two control files.
 *
 * A job file is the header "RenderJobControl" with the check interval
 * (minutes, seconds) and then job blocks; a resource file is the header
 * "RenderResourceControl" and resource blocks.  Each block names a record by
 * name and index; the record of that index is found or made (Add_a_job,
 * Add_a_dev), so reading a file over records already in memory updates them
 * in place.  Statements may come in any order and may repeat: the last value
 * of a field stands, search paths, resources and schedule blocks add up.
 *
 * Unknown run states, lock states, resource names and days are not errors:
 * they map to "unset" or drop out.  A syntax error ends the process (see
 * RJCerror); an empty input is an empty file, not an error.
 *
 * Every text token (word, string, comment) points into the lexer's own
 * buffers and stays valid only until its statement is reduced: an action
 * copies what a record keeps (Text::set, or the record functions, which take
 * copies of their own).
 */

/* The older prefix directive, not api.prefix: the latter would also rename
 * the parser's error token to RJCerror, the name of the error routine. */
%name-prefix "RJC"
%expect 0

%code requires {
#include <cstddef>
}

%code {
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "Shared/memory/MA_rtns.h"
#include "Utility/rndctl/base/rj_control.h"
#include "Utility/rndctl/base/rj_log.h"
#include "Utility/rndctl/base/rj_text.h"
#include "Utility/rndctl/ctldir/rj_fileio.h"
#include "Utility/rndctl/ctlfile/rj_ctlfile.h"
#include "Utility/rndctl/records/rj_dev.h"
#include "Utility/rndctl/records/rj_job.h"
#include "Utility/rndctl/records/rj_lst.h"
#include "Utility/rndctl/records/rj_records.h"
#include "Utility/rndctl/records/rj_schedule.h"

void RJC_lex_begin();
void RJC_lex_end();
static const char* message_file();

namespace {

constexpr const char* kUnit = "Utility/rndctl/RJCgram";

// What the current file is, and the records the statements apply to.  The
// records belong to the control block's lists; these are non-owning.
enum { MODE_NONE = 0, MODE_JOBS = 1, MODE_RESOURCES = 2 };
int mode = MODE_NONE;
Job* cur_job = nullptr;
Dev* cur_dev = nullptr;

// A copy of a parsed text into a record field, replacing the old value.
void give(Text& field, const char* text) { field.set(text, __LINE__, kUnit); }

// Bison's own wording, in the words the logs have always carried.
const char* parser_message(const char* text) {
  if (strcmp(text, "syntax error") == 0) return "Syntax error";
  if (strcmp(text, "memory exhausted") == 0) return "Yacc stack overflow";
  return text;
}

// A schedule block { t1 to t2 day [to day] } is applied only when every day
// word names a day.  The first day is copied before the second lookup, so a
// lookup that answers from a buffer of its own cannot overwrite it.
bool block_days(const char* word1, const char* word2, char (&first)[16], const char** last) {
  const char* d1 = Schedule_get_day(word1);
  if (d1 == nullptr) return false;
  snprintf(first, sizeof first, "%s", d1);
  *last = Schedule_get_day(word2 != nullptr ? word2 : word1);
  return *last != nullptr;
}

void run_block(int t1, int t2, const char* word1, const char* word2) {
  char first[16];
  const char* last = nullptr;
  if (cur_job != nullptr && block_days(word1, word2, first, &last))
    Schedule_job_runs(cur_job, t1, t2, first, last);
}

void lock_block(int t1, int t2, const char* word1, const char* word2) {
  char first[16];
  const char* last = nullptr;
  if (cur_dev != nullptr && block_days(word1, word2, first, &last))
    Schedule_dev_lock(cur_dev, t1, t2, first, last);
}

void begin_job(const char* name, int index) {
  cur_job = Add_a_job_as_read(name, index);
  if (cur_job == nullptr) return;
  // Only what the file says stands: the defaults a new record starts with
  // (and, for a record read before, its old values) are dropped for these.
  cur_job->comment.reset();
  cur_job->user.reset();
  cur_job->pix.reset();
  cur_job->sdl.reset();
  cur_job->matte.reset();
  cur_job->rnd_opts.reset();
}

void begin_dev(const char* name, int index) {
  cur_dev = Add_a_dev(nullptr, name, index);
}

void job_text(Text Job::*field, const char* text) {
  if (cur_job != nullptr) give(cur_job->*field, text);
}

void dev_text(Text Dev::*field, const char* text) {
  if (cur_dev != nullptr) give(cur_dev->*field, text);
}

void job_int(int Job::*field, int value) {
  if (cur_job != nullptr) cur_job->*field = value;
}

void dev_int(int Dev::*field, int value) {
  if (cur_dev != nullptr) cur_dev->*field = value;
}

}  // namespace

#define YY_(Msgid) parser_message(Msgid)

int RJClex();
}

%union {
  int ival;
  float rval;
  char* sval;
}

/* Token numbers are part of the format's history (the extension flag stores
 * the number of TRUE): the declaration order below gives them, from 258 on,
 * and the unused numbers are held by tokens the lexer never returns. */
%token TK_JOBCONTROL      /* 258 */
%token TK_STATUS          /* 259 */
%token TK_PRIORITY
%token TK_EXECUTABLE
%token TK_USE_SDL_PATHS
%token TK_OUTPUT_MASK
%token TK_SAVE_OUT
%token TK_SDL
%token TK_PIX
%token TK_MATTE
%token TK_ANIMATE
%token TK_FIELDS
%token TK_FRAMES
%token TK_EXTENSION
%token TK_TOTALFRAMES
%token TK_DONEFRAMES
%token TK_RESOURCES
%token TK_SEARCHPATH
%token TK_DEL_WHEN_DONE
%token TK_RND_OPTS
%token TK_CTRL            /* 278 */
%token TK_UNUSED_279
%token TK_RUNS            /* 280 */
%token TK_UNUSED_281
%token TK_RESCONTROL      /* 282 */
%token TK_HOST_NAME       /* 283 */
%token TK_REMOTE_LOCATION
%token TK_RSTATUS
%token TK_MAX_FRAMES
%token TK_NUM_PROCESSORS
%token TK_LOCKS
%token TK_DEFAULT_DEV     /* 289 */
%token TK_LOCK_PID        /* 290 */
%token TK_TRUE            /* 291 */
%token TK_FALSE           /* 292 */
%token TK_USER            /* 293 */
%token TK_TO              /* 294 */
%token TK_UNUSED_295
%token <sval> TK_WORD     /* 296 */
%token <ival> TK_INTEGER  /* 297 */
%token <rval> TK_REAL     /* 298 */
%token <sval> TK_STRING   /* 299 */
%token <sval> TK_COMMENT  /* 300 */

%type <ival> flag
%type <rval> number
%type <sval> name

%initial-action {
  mode = MODE_NONE;
  cur_job = nullptr;
  cur_dev = nullptr;
  RJC_lex_begin();
}

%%

file
  : %empty
  | job_header job_items
  | res_header res_items
  ;

job_header
  : TK_JOBCONTROL TK_INTEGER TK_INTEGER
      {
        // A value the daemon cannot wait for is refused and reported; the
        // interval in force stays.
        mode = MODE_JOBS;
        (void)RJC_set_check_interval($2, $3, message_file());
      }
  ;

res_header
  : TK_RESCONTROL { mode = MODE_RESOURCES; }
  ;

/* Comments between blocks belong to nothing and are dropped. */
job_items
  : %empty
  | job_items job_block
  | job_items TK_COMMENT
  ;

res_items
  : %empty
  | res_items res_block
  | res_items TK_COMMENT
  ;

job_block
  : job_open job_stmts '}'
  ;

job_open
  : name TK_INTEGER '{' { begin_job($1, $2); }
  ;

job_stmts
  : %empty
  | job_stmts job_stmt
  ;

job_stmt
  : TK_COMMENT                              { job_text(&Job::comment, $1); }
  | TK_USER '=' name ';'                    { job_text(&Job::user, $3); }
  | TK_EXECUTABLE '=' name ';'              { job_text(&Job::executable, $3); }
  | TK_STATUS '=' TK_STRING ';'             { job_text(&Job::status, $3); }
  | TK_SDL '=' TK_STRING ';'                { job_text(&Job::sdl, $3); }
  | TK_PIX '=' TK_STRING ';'                { job_text(&Job::pix, $3); }
  | TK_MATTE '=' TK_STRING ';'              { job_text(&Job::matte, $3); }
  | TK_RND_OPTS '=' TK_STRING ';'           { job_text(&Job::rnd_opts, $3); }
  | TK_SEARCHPATH '=' TK_STRING ';'
      {
        if (cur_job != nullptr) RndPathList_add(cur_job, $3);
      }
  | TK_PRIORITY '=' TK_INTEGER ';'          { job_int(&Job::priority, $3); }
  | TK_FIELDS '=' TK_INTEGER ';'            { job_int(&Job::fields, $3); }
  | TK_TOTALFRAMES '=' TK_INTEGER ';'       { job_int(&Job::totalframes, $3); }
  | TK_DONEFRAMES '=' TK_INTEGER ';'        { job_int(&Job::doneframes, $3); }
  | TK_LOCK_PID '=' TK_INTEGER ';'          { job_int(&Job::lock_pid, $3); }
  | TK_ANIMATE '=' flag ';'                 { job_int(&Job::animate, $3); }
  | TK_DEL_WHEN_DONE '=' flag ';'           { job_int(&Job::del_when_done, $3); }
  | TK_USE_SDL_PATHS '=' flag ';'           { job_int(&Job::use_sdl_paths, $3); }
  | TK_OUTPUT_MASK '=' flag ';'             { job_int(&Job::output_mask, $3); }
  | TK_SAVE_OUT '=' flag ';'                { job_int(&Job::save_out, $3); }
  | TK_CTRL '=' TK_WORD ';'
      {
        job_int(&Job::ctrl, Job_get_runstate($3));
      }
  | TK_FRAMES '=' number ',' number ',' number ';'
      {
        if (cur_job != nullptr) {
          cur_job->frames[0] = $3;
          cur_job->frames[1] = $5;
          cur_job->frames[2] = $7;
        }
      }
  | TK_EXTENSION '=' TK_INTEGER ',' TK_INTEGER ',' TK_INTEGER ';'
      {
        if (cur_job != nullptr) {
          cur_job->ext_start = $3;
          cur_job->ext_by = $5;
          cur_job->ext_size = $7;
          // Any non-zero word means "extension numbering in use"; the value
          // stored has always been the number of the TRUE token.
          cur_job->extension = TK_TRUE;
        }
      }
  | TK_RESOURCES '=' dev_names ';'
  | TK_RUNS '=' run_blocks ';'
  ;

/* A name that is no single word (a blank, a quote, a number such as a host
 * address, a keyword) is written as a string. */
name
  : TK_WORD    { $$ = $1; }
  | TK_STRING  { $$ = $1; }
  ;

flag
  : TK_TRUE   { $$ = 1; }
  | TK_FALSE  { $$ = 0; }
  ;

/* The writer prints frames with six decimals; a hand-written whole number is
 * taken as well. */
number
  : TK_REAL     { $$ = $1; }
  | TK_INTEGER  { $$ = static_cast<float>($1); }
  ;

dev_names
  : dev_name
  | dev_names ',' dev_name
  ;

/* A resource the resource file does not hold drops out of the job. */
dev_name
  : name
      {
        if (cur_job != nullptr) {
          Dev* dev = Dev_by_name($1);
          if (dev != nullptr) RndDevList_add(cur_job, dev);
        }
      }
  ;

run_blocks
  : run_block
  | run_blocks ',' run_block
  ;

run_block
  : '{' TK_INTEGER TK_TO TK_INTEGER TK_WORD '}'                 { run_block($2, $4, $5, nullptr); }
  | '{' TK_INTEGER TK_TO TK_INTEGER TK_WORD TK_TO TK_WORD '}'   { run_block($2, $4, $5, $7); }
  ;

res_block
  : res_open res_stmts '}'
  ;

res_open
  : name TK_INTEGER '{' { begin_dev($1, $2); }
  ;

res_stmts
  : %empty
  | res_stmts res_stmt
  ;

/* A resource comment is written for people reading the file; nothing reads
 * it back into the record. */
res_stmt
  : TK_COMMENT
  | TK_HOST_NAME '=' name ';'               { dev_text(&Dev::host_name, $3); }
  | TK_REMOTE_LOCATION '=' TK_STRING ';'    { dev_text(&Dev::remote_location, $3); }
  | TK_RSTATUS '=' TK_WORD ';'
      {
        dev_int(&Dev::status, Dev_get_lockstate($3));
      }
  | TK_LOCK_PID '=' TK_INTEGER ';'          { dev_int(&Dev::lock_pid, $3); }
  | TK_MAX_FRAMES '=' TK_INTEGER ';'        { dev_int(&Dev::max_frames, $3); }
  | TK_NUM_PROCESSORS '=' TK_INTEGER ';'    { dev_int(&Dev::num_processors, $3); }
  | TK_DEFAULT_DEV '=' TK_INTEGER ';'       { dev_int(&Dev::default_dev, $3); }
  | TK_LOCKS '=' lock_blocks ';'
  ;

lock_blocks
  : lock_block
  | lock_blocks ',' lock_block
  ;

lock_block
  : '{' TK_INTEGER TK_TO TK_INTEGER TK_WORD '}'                 { lock_block($2, $4, $5, nullptr); }
  | '{' TK_INTEGER TK_TO TK_INTEGER TK_WORD TK_TO TK_WORD '}'   { lock_block($2, $4, $5, $7); }
  ;

%%

void (*RJC_fatal_exit)(int status) = nullptr;

static_assert(TK_JOBCONTROL == 258 && TK_STATUS == 259 && TK_CTRL == 278 && TK_RUNS == 280);
static_assert(TK_RESCONTROL == 282 && TK_HOST_NAME == 283 && TK_DEFAULT_DEV == 289);
static_assert(TK_LOCK_PID == 290 && TK_TRUE == 291 && TK_FALSE == 292 && TK_USER == 293);
static_assert(TK_TO == 294 && TK_WORD == 296 && TK_INTEGER == 297 && TK_REAL == 298);
static_assert(TK_STRING == 299 && TK_COMMENT == 300);

/* Which file the messages name: the caller's name for it, else the file the
 * header announced. */
static const char* message_file() {
  if (RJCreadfile != nullptr) return RJCreadfile;
  if (mode == MODE_JOBS) return "Render_Job_Control";
  if (mode == MODE_RESOURCES) return "Render_Resource_Control";
  return "(null)";
}

/* A control file the parser cannot read is not something to guess around:
 * every daemon and editor would act on a different idea of the queue.  The
 * process ends; the records read so far die with it.  When a test or a
 * fuzzer has installed RJC_fatal_exit and it returns, the parse is abandoned
 * instead: RJCparse returns non-zero and frees what it held. */
void RJCerror(const char* message) {
  const char* file = message_file();
  dbgpnt("%s: line %d of %s file\n", message, RJCcurrent_lineno, file);
  fprintf(stdout, "******** %s: line %d of %s file\n", message, RJCcurrent_lineno, file);
  fflush(stdout);
  wrt_logfile("Exiting ******** %s: line %d of %s file", message, RJCcurrent_lineno, file);
  fileop_release_held_locks();  // the other hosts go on once the file is repaired
  if (RJC_fatal_exit != nullptr) {
    RJC_fatal_exit(-1);
    return;
  }
  abort();
  exit(-1);
}

int RJC_parse_string(const char* text, size_t length, const char* file_name) {
  const char* saved_file = RJCreadfile;
  FILE* saved_in = RJCin;
  RJCreadfile = file_name;
  FILE* stream = nullptr;
  // fmemopen refuses an empty buffer; an empty text reads as no stream.
  if (text != nullptr && length > 0) stream = fmemopen(const_cast<char*>(text), length, "r");
  RJCin = stream;
  int result = RJCparse();
  RJC_lex_end();
  if (stream != nullptr) fclose(stream);
  RJCin = saved_in;
  RJCreadfile = saved_file;
  return result;
}
