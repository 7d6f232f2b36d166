#include "core/Log.h"

int main() {
    qax::qaxLog().info("launched");
    return 0;
}
