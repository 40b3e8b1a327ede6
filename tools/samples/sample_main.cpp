// The executable of the sample application and of its plug-ins: it only says who it is. The
// build copies it into each bundle, where a signature binds the copy to that bundle's identifier.
#include <cstdio>

int main(int argc, char** argv) {
    std::printf("%s: a sample of the Annexa demo\n", argc > 0 ? argv[0] : "sample");
    return 0;
}
