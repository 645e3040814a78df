#include "platform/fileprovider/extension_main.h"
#include "provider/extension/extension.h"

int main(int argc, char** argv) {
  return yomber::NSExtensionMain(argc, argv,
                                 [] { return yomber::QSFileProviderExtension::init(); });
}
