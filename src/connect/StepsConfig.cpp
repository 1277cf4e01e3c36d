#include "connect/StepsConfig.h"

namespace kesu {

// Each "result" member maps a result name to [numeric result, description] and, for some
// entries, a third element: the code the result is reported under elsewhere.

const std::string_view stepsConfig = R"JSON({
"BLE_GET_CONNECT_STATE":{"code":"CI","descriptor":"获取PC连接状态","name":"获取PC连接状态","result":{"OK":["0","可以连接"],"FAILED":["-1","正在连接中"]}},
"BLE_FIND_DEVICES":{"code":"NF","descriptor":"设备列表中是否存在该设备","name":"设备列表中是否存在该设备","result":{"OK":["0","设备存在"],"FAILED":["-1","设备不存在"],"CANCEL":["-90","用户取消"],"BLE_ERROR":["-91","蓝牙状态异常"]}},
"BLE_CONNECT_BLUETOOTH_ADDRESS":{"code":"BC","descriptor":"通过MAC地址连接手机","name":"通过MAC地址连接手机","result":{"OK":["0","连接成功"],"FAILED":["-1","连接失败"],"CANCEL":["-90","用户取消"],"BLE_ERROR":["-91","蓝牙状态异常"]}},
"BLE_GET_GATTSERVICE":{"code":"GS","descriptor":"获取手机GATT服务","name":"获取手机GATT服务","result":{"OK":["0","获取成功"],"STATE_ERROR":["-1","获取失败"],"CANCEL":["-90","用户取消"],"BLE_ERROR":["-91","蓝牙状态异常"]}},
"BLE_GET_CHARACTERISTICS":{"code":"GC","descriptor":"获取手机读写特征值","name":"获取手机读写特征值","result":{"OK":["0","获取成功"],"RECEIVER_EXTRACHARACTERISTICS_ERROR":["-1","获取读写特征值失败"],"CONFIGURATIONDESCRIPTOR_ERROR":["-2","配置描述符失败"],"REQUEST_CHARACTERISTICS_ERROR":["-3","请求特征值失败"],"CANCEL":["-90","用户取消"],"BLE_ERROR":["-91","蓝牙状态异常"]}},
"BLE_GET_WIFI_DIRECTMAC":{"code":"AA","descriptor":"获取MAC地址","name":"获取MAC地址","result":{"OK":["0","获取成功"],"MACISEMPTY":["-1","MAC地址为空"]}},
"BLE_CREATE_AP":{"code":"AP","descriptor":"创建热点","name":"创建热点","result":{"OK":["0","创建成功"],"FAILED":["-1","创建失败"]}},
"BLE_SEND_AP_INFO":{"code":"PC","descriptor":"发送热点信息给手机","name":"发送热点信息给手机","result":{"OK":["0","发送成功"],"FAILED":["-1","发送失败"],"CANCEL":["-90","用户取消"],"BLE_ERROR":["-91","蓝牙状态异常"]}},
"BLE_RECV_RESPONSE":{"code":"TO","descriptor":"等待手机回复","name":"等待手机回复","result":{"OK":["0","手机同意"],"TIMEOUT":["-1","等待超时"],"BUSY":["-2","手机繁忙"],"REJECT":["-3","手机拒绝"],"CANCEL":["-90","用户取消"],"BLE_ERROR":["-91","蓝牙状态异常"]}},
"BLE_RECV_PHONE_IP":{"code":"NI","descriptor":"等待手机上报IP","name":"等待手机上报IP","result":{"OK":["0","收到手机IP"],"FAILED":["-1","未收到手机IP"],"PHONECANCEL":["-2","手机取消"],"CANCEL":["-90","用户取消"],"BLE_ERROR":["-91","蓝牙状态异常"]}},
"WLAN_GET_CONNECT_STATE":{"code":"WI","descriptor":"获取PC的WLAN连接状态","name":"获取PC的WLAN连接状态","result":{"OK":["0","可以连接"],"FAILED":["-1","正在连接中"]}},
"WLAN_FIND_DEVICES":{"code":"WF","descriptor":"WLAN设备列表中是否存在该设备","name":"WLAN设备列表中是否存在该设备","result":{"OK":["0","设备存在"],"FAILED":["-1","设备不存在"],"CANCEL":["-90","用户取消"]}},
"WLAN_CONNECT_SERVER":{"code":"TF","descriptor":"连接手机端10191端口","name":"连接手机端10191端口","result":{"OK":["0","连接成功"],"FAILED":["-1","连接失败"]}},
"WLAN_RECV_RESPONSE":{"code":"WO","descriptor":"WLAN等待手机回复","name":"WLAN等待手机回复","result":{"OK":["0","手机同意"],"TIMEOUT":["-1","等待超时"],"BUSY":["-2","手机繁忙"],"REJECT":["-3","手机拒绝"],"CANCEL":["-90","用户取消"]}}
})JSON";

const std::string_view os4StepsConfig = R"JSON({
"BT_CONNECT_BLUETOOTH_ADDRESS":{"code":"BCB","descriptor":"蓝牙预连接：通过MAC地址连接手机","name":"蓝牙预连接：通过MAC地址连接手机","result":{"OK":["0","连接成功"],"FAILED":["-1","连接失败"]}},
"BT_SEND_DEVICE_INFO":{"code":"BSD","descriptor":"蓝牙预连接：PC发送设备信息握手","name":"蓝牙预连接：PC发送设备信息握手","result":{"OK":["0","发送成功"],"FAILED":["-1","发送失败"]}},
"BT_RECV_DEVICE_INFO":{"code":"BRD","descriptor":"蓝牙预连接：接收手机设备信息","name":"蓝牙预连接：接收手机设备信息","result":{"OK":["0","接收成功"],"FAILED":["-1","接收失败"]}},
"BT_PARSER_DEVICE_INFO":{"code":"BPD","descriptor":"蓝牙预连接：解析手机握手信息","name":"蓝牙预连接：解析手机握手信息","result":{"OK":["0","解析成功"],"FAILED":["-1","解析失败"]}},
"WLAN_PING_ADDRESS":{"code":"WPI","descriptor":"局域网预连接：ping手机IP","name":"局域网预连接：ping手机IP","result":{"OK":["0","ping成功"],"FAILED":["-1","ping失败"]}},
"WLAN_TELNET_ADDRESS":{"code":"WTN","descriptor":"局域网预连接：探测手机10191端口","name":"局域网预连接：探测手机10191端口","result":{"OK":["0","端口可达"],"FAILED":["-1","端口不可达"]}},
"WLAN_CONNECT_ADDRESS":{"code":"WCA","descriptor":"局域网预连接：连接手机10191端口","name":"局域网预连接：连接手机10191端口","result":{"OK":["0","连接成功"],"FAILED":["-1","连接失败"]}},
"WLAN_SEND_DEVICE_INFO":{"code":"WSD","descriptor":"局域网预连接：PC发送设备信息握手","name":"局域网预连接：PC发送设备信息握手","result":{"OK":["0","发送成功"],"FAILED":["-1","发送失败"]}},
"WLAN_RECV_DEVICE_INFO":{"code":"WRD","descriptor":"局域网预连接：接收手机设备信息","name":"局域网预连接：接收手机设备信息","result":{"OK":["0","接收成功"],"FAILED":["-1","接收失败"]}},
"WLAN_PARSER_DEVICE_INFO":{"code":"WPD","descriptor":"局域网预连接：解析手机握手信息","name":"局域网预连接：解析手机握手信息","result":{"OK":["0","解析成功"],"FAILED":["-1","解析失败"]}},
"BT_FIND_DEVICES":{"code":"BFD","descriptor":"蓝牙连接：查找设备","name":"蓝牙连接：查找设备","result":{"OK":["0","设备存在"],"FAILED":["-1","设备不存在"],"CANCEL":["-90","用户取消","-1"],"PRECONNECT_ERROR":["-10","设备未预连接"]}},
"BT_CREATE_WIFIP2P":{"code":"BCW","descriptor":"蓝牙连接：创建Wi-Fi P2P","name":"蓝牙连接：创建Wi-Fi P2P","result":{"OK":["0","创建成功"],"FAILED":["-1","创建失败"],"CANCEL":["-90","用户取消","-1"],"OPEN_AP":["-21","热点已打开且有设备接入","-1"],"OPEN_WIFI_ERROR":["-20","打开Wi-Fi失败"]}},
"BT_SEND_WIFIP2P_INFO":{"code":"BSW","descriptor":"蓝牙连接：PC发送Wi-Fi P2P信息","name":"蓝牙连接：PC发送Wi-Fi P2P信息","result":{"OK":["0","发送成功"],"FAILED":["-1","发送失败"],"CANCEL":["-90","用户取消","-1"]}},
"BT_RECV_RESPONSE":{"code":"BRR","descriptor":"蓝牙连接：接收手机回复","name":"蓝牙连接：接收手机回复","result":{"OK":["0","接收成功"],"FAILED":["-1","接收失败"],"CANCEL":["-90","用户取消","-1"]}},
"BT_PARSER_RESPONSE":{"code":"BPR","descriptor":"蓝牙连接：解析手机回复","name":"蓝牙连接：解析手机回复","result":{"OK":["0","手机同意"],"FAILED":["-1","解析失败"],"CANCEL":["-90","用户取消","-1"],"BUSY":["-2","手机繁忙","-1"],"REJECT":["-3","手机拒绝","-1"]}},
"BT_GET_WIFIP2P_IP":{"code":"BGW","descriptor":"蓝牙连接：获取Wi-Fi P2P对端IP","name":"蓝牙连接：获取Wi-Fi P2P对端IP","result":{"OK":["0","获取成功"],"FAILED":["-1","获取失败"],"CANCEL":["-90","用户取消","-1"]}},
"WLAN_FIND_DEVICES":{"code":"WFD","descriptor":"局域网连接：查找设备","name":"局域网连接：查找设备","result":{"OK":["0","设备存在"],"FAILED":["-1","设备不存在"],"CANCEL":["-90","用户取消","-1"],"PRECONNECT_ERROR":["-10","设备未预连接"]}},
"WLAN_SEND_REQUEST":{"code":"WSR","descriptor":"局域网连接：PC发送连接请求","name":"局域网连接：PC发送连接请求","result":{"OK":["0","发送成功"],"FAILED":["-1","发送失败"],"CANCEL":["-90","用户取消","-1"]}},
"WLAN_RECV_RESPONSE":{"code":"WRR","descriptor":"局域网连接：接收手机回复","name":"局域网连接：接收手机回复","result":{"OK":["0","接收成功"],"FAILED":["-1","接收失败"],"CANCEL":["-90","用户取消","-1"]}},
"WLAN_PARSER_RESPONSE":{"code":"WPR","descriptor":"局域网连接：解析手机回复","name":"局域网连接：解析手机回复","result":{"OK":["0","手机同意"],"FAILED":["-1","解析失败"],"CANCEL":["-90","用户取消","-1"],"BUSY":["-2","手机繁忙","-1"],"REJECT":["-3","手机拒绝","-1"]}}
})JSON";

}  // namespace kesu
