#include "xqpub/klpkccmd.h"

int main(int c, char** v) { return klpkccmdMain(c, v); }
