/* A shared object that is no adaptor: it lacks the one function. */
int somethingElse(void);
int somethingElse(void) { return 0; }
