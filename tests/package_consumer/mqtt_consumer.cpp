// Built by the installed-package check when the package has the MQTT
// transport: constructs one (without starting it) through the installed header.
#include "tessarine/mqtt/MqttTransport.h"

int main() {
    lumivale::tessarine::mqtt::MqttTransport::Options options;
    options.port = 1883;
    lumivale::tessarine::mqtt::MqttTransport transport(options);
    return transport.isConnected() ? 1 : 0;
}
