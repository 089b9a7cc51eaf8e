/* The platform's functions as a whole: modules find them in the program that hosts them. */
#pragma once

namespace host {

/* Does nothing but ask for every room's platform functions, so that a program that links the host
 * has all of them in its dynamic symbol table, whatever it uses itself. */
void linkPlatform();

}  // namespace host
