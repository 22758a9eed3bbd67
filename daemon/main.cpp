#include "daemon/wccpd_main.h"

int main() {
    return wccpd_main();
}
