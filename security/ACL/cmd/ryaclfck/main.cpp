// ryaclfck: checks one ACL file for syntactic and semantic validity.
#include <clocale>

#include "aclfck.h"

int main(int argc, char **argv) {
    std::setlocale(LC_ALL, "");
    return aclfck__main(argc, argv);
}
