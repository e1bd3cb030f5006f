#include "unix/handlers.h"
#include "unix/xmain.h"

int main(int argc, char** argv) {
    try {
        return xmain(argc, argv);
    } catch (...) {
        AbnormalTermination();
    }
}
