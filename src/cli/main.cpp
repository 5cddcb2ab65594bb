#include "cli/HTHeftMain.h"
#include "platform/linux/HTLinuxPlatform.h"

#include <memory>

int main(int argc, char** argv)
{
    return heftMain(argc, argv, std::make_shared<HTLinuxPlatform>());
}
