/* The daemon's command line. */
#ifndef CORE_LOG_OPTIONS_H
#define CORE_LOG_OPTIONS_H

enum class log_options_result {
    run,  /* options applied, go on */
    help, /* the usage text was asked for and printed: end with status 0 */
};

/*
 * Applies the options in their order: -a and -p write NV, for this start and every later one, -r sets the
 * number of connect tries for this one. Unknown options are passed over. Called once, before any thread is
 * started.
 */
log_options_result log_parse_options(int argc, char **argv);

#endif
