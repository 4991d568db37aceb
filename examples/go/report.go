// Reporting from Go, over the C interface: a few functions around it, to be copied into a program of your own, and a
// program that sends one event. No callback of the library's is used, so nothing of it ever runs on a thread that Go does
// not know. Any goroutine may call what is here.
package main

/*
#cgo pkg-config: kytreporting
#include <kytreporting/kytreporting.h>
#include <stdlib.h>
*/
import "C"

import (
	"errors"
	"fmt"
	"os"
	"time"
	"unsafe"
)

// ErrQueueFull says that the bounded queue had no room: the message is dropped, and counted.
var ErrQueueFull = errors.New("the queue is full")

const textBytes = 256

// Session is one reporting session. It reconnects by itself; Close frees it.
type Session struct {
	handle *C.kyt_session
}

// A dictionary of the library's, to be freed. Values are texts, numbers and booleans.
func dictionary(entries map[string]any) (*C.kyt_dictionary, error) {
	made := C.kyt_dictionary_new()
	for name, value := range entries {
		if err := set(made, name, value); err != nil {
			C.kyt_dictionary_free(made)
			return nil, err
		}
	}
	return made, nil
}

func set(into *C.kyt_dictionary, name string, value any) error {
	key := C.CString(name)
	defer C.free(unsafe.Pointer(key))
	switch given := value.(type) {
	case string:
		text := C.CString(given)
		defer C.free(unsafe.Pointer(text))
		C.kyt_dictionary_set_string(into, key, text)
	case bool:
		C.kyt_dictionary_set_bool(into, key, number(given))
	case int:
		C.kyt_dictionary_set_int(into, key, C.int64_t(given))
	case float64:
		C.kyt_dictionary_set_double(into, key, C.double(given))
	default:
		return fmt.Errorf("%s: a value of the type %T cannot be sent", name, value)
	}
	return nil
}

func number(yes bool) C.int {
	if yes {
		return 1
	}
	return 0
}

// Open makes a session and configures it; it never waits for the daemon.
func Open(clientType int, client, service string) (*Session, error) {
	info, err := dictionary(map[string]any{"ClientType": clientType, "RequireUserInfo": true})
	if err != nil {
		return nil, err
	}
	defer C.kyt_dictionary_free(info)
	user, err := dictionary(map[string]any{"ClientName": client, "ServiceName": service})
	if err != nil {
		return nil, err
	}
	defer C.kyt_dictionary_free(user)
	var why [textBytes]C.char
	if C.kyt_session_info_check(info, &why[0], textBytes) == 0 {
		return nil, errors.New(C.GoString(&why[0]))
	}
	// In C's memory, since it points to objects of the library's.
	options := (*C.kyt_options)(C.calloc(1, C.sizeof_kyt_options))
	defer C.free(unsafe.Pointer(options))
	options.size = C.sizeof_kyt_options
	options.session_info = info
	options.user_info = user
	session := &Session{C.kyt_session_open(options)}
	C.kyt_session_configure(session.handle, nil, nil)
	return session, nil
}

// Send queues one message, and does not wait. The error has the library's text.
func (session *Session) Send(category, kind int, payload map[string]any) error {
	made, err := dictionary(payload)
	if err != nil {
		return err
	}
	defer C.kyt_dictionary_free(made)
	var why [textBytes]C.char
	switch C.kyt_session_try_send(session.handle, C.uint32_t(category), C.uint32_t(kind), made, 0, &why[0], textBytes) {
	case C.KYT_ERROR_NONE:
		return nil
	case C.KYT_ERROR_QUEUE_FULL:
		return ErrQueueFull
	}
	return errors.New(C.GoString(&why[0]))
}

// Finish sends what is queued and waits so long at most; whether the daemon has taken all.
func (session *Session) Finish(timeout time.Duration) bool {
	return C.kyt_session_finish(session.handle, C.uint(timeout.Milliseconds())) != 0
}

// Close ends and frees the session: nothing may use it any more.
func (session *Session) Close() {
	C.kyt_session_close(session.handle)
	session.handle = nil
}

func report() error {
	session, err := Open(20, "hello", "demo")
	if err != nil {
		return err
	}
	defer session.Close()
	if err := session.Send(10, 1, map[string]any{"step": 1, "duration": 0.25}); err != nil {
		return err
	}
	if !session.Finish(5 * time.Second) {
		return errors.New("the daemon has not taken all")
	}
	return nil
}

func main() {
	if err := report(); err != nil {
		fmt.Fprintln(os.Stderr, "report:", err)
		os.Exit(1)
	}
}
