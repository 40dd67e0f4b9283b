#!/usr/bin/env python3
"""The explorer page of `delvix-host serve` in headless Chromium, on a small seeded store: the
cameras, a search whose thumbnails decode, a re-identification that puts its own hit first, a
case made from two hits, changed and deleted, a drawn line rule, a client per tab, and the
messages for an empty window, an unknown camera and a stopped host. Every wait is for an element
or a state of the page, never a fixed time."""
import argparse
import os
import re
import shutil
import subprocess
import sys
import tempfile

from selenium import webdriver
from selenium.webdriver.chrome.service import Service
from selenium.webdriver.common.action_chains import ActionChains
from selenium.webdriver.common.by import By
from selenium.webdriver.support.ui import Select, WebDriverWait

SEEDED_FROM = 'Date.UTC(2024, 0, 1)'  # the seeder spreads its objects over four hours from here
DECODED_THUMBS = "return [...document.querySelectorAll(arguments[0])].filter(i => i.complete && i.naturalWidth > 0).length"
# Texts read in one step inside the page: lists it re-renders meanwhile cannot go stale under us.
TEXTS = "return [...document.querySelectorAll(arguments[0])].map(e => e.textContent)"


def browser():
    options = webdriver.ChromeOptions()
    options.binary_location = shutil.which('chromium') or ''
    assert options.binary_location and shutil.which('chromedriver'), 'chromium and chromedriver: run ./run deps'
    for flag in ('--headless=new', '--no-sandbox', '--disable-dev-shm-usage', '--window-size=1400,1600'):
        options.add_argument(flag)
    return webdriver.Chrome(service=Service(shutil.which('chromedriver')), options=options)


def set_window(driver, start_expr, hours):
    driver.execute_script(f"""const start = new Date({start_expr});
        document.getElementById('start').value = localInputValue(start);
        document.getElementById('end').value = localInputValue(new Date(start.getTime() + {hours} * 3600e3));""")


def search_message(driver, wait):
    driver.find_element(By.ID, 'search-button').click()
    wait.until(lambda d: d.find_element(By.ID, 'message').is_displayed())
    return driver.find_element(By.ID, 'message').text


def check(driver, wait, screenshot, stop_host):
    css = lambda selector: driver.find_elements(By.CSS_SELECTOR, selector)
    wait.until(lambda d: len(css('#cameras tr[data-camera]')) == 5)
    table = driver.find_element(By.ID, 'cameras').text
    assert 'ParkingGate' in table and 'protected' in table and 'offline' in table, table

    # An empty window is refused on the page, before anything is asked.
    set_window(driver, SEEDED_FROM, 0)
    assert 'time window is empty' in search_message(driver, wait)
    set_window(driver, SEEDED_FROM, 4)
    driver.find_element(By.ID, 'places').send_keys('Nowhere')
    assert 'Unknown camera or location: Nowhere' in search_message(driver, wait)
    driver.find_element(By.ID, 'places').clear()
    tick = "document.querySelectorAll('#camera-picks input').forEach(box => { box.checked = arguments[0]; })"
    driver.execute_script(tick, False)
    assert 'Pick at least one camera' in search_message(driver, wait)
    driver.execute_script(tick, True)

    driver.find_element(By.ID, 'search-button').click()
    wait.until(lambda d: d.find_element(By.ID, 'search-section').get_attribute('data-state') == 'done')
    assert driver.find_element(By.ID, 'count').text == '201 shown, refine to see more'
    assert not driver.find_element(By.ID, 'message').is_displayed()
    wait.until(lambda d: d.execute_script(DECODED_THUMBS, '#hits img.thumb') == 201)
    assert css('#hits img.face') and css('#hits svg.trajectory polyline')
    words = driver.execute_script(TEXTS, '#hits .what')
    assert all(re.search(r'\b(female|male)\b', w) for w in words), words[:3]
    driver.save_screenshot(screenshot)

    first = css('#hits article.hit')[0]
    hit = first.get_attribute('data-object')
    first.find_element(By.CSS_SELECTOR, 'button.reid').click()
    wait.until(lambda d: d.find_element(By.ID, 'reid-section').get_attribute('data-state') == 'done')
    rows = css('#reid-list tbody tr')
    assert len(rows) > 1 and rows[0].get_attribute('data-object') == hit, (hit, rows[0].text if rows else None)
    assert rows[0].find_element(By.CSS_SELECTOR, '.score').text == '1.000'
    assert css('#timeline .mark')

    for box in css('#hits .pick')[:2]:
        box.click()
    driver.find_element(By.ID, 'case-name').send_keys('Browser case')
    driver.find_element(By.ID, 'make-case').click()
    wait.until(lambda d: 'made with 2 item' in d.find_element(By.ID, 'case-progress-text').text)
    case = '#case-list .case'
    cases = lambda: ' '.join(driver.execute_script(TEXTS, case))
    wait.until(lambda d: 'Browser case' in cases())
    wait.until(lambda d: d.execute_script(DECODED_THUMBS, case + ' img.cover') >= 1)
    css(case + ' button.open')[0].click()
    wait.until(lambda d: len(css('#case-items article')) == 2)
    css('#case-items button.remove')[0].click()
    wait.until(lambda d: len(css('#case-items article')) == 1)
    driver.find_element(By.ID, 'case-rename').send_keys(' renamed')
    driver.find_element(By.ID, 'case-rename-button').click()
    wait.until(lambda d: 'Browser case renamed' in cases())
    delete = css(case + ' button.delete')[0]
    delete.click()
    delete.click()  # the second click confirms
    wait.until(lambda d: 'Browser case' not in cases())

    # A drawn line on one camera's frame: a search of that camera for the objects that crossed it.
    Select(driver.find_element(By.ID, 'rule-kind')).select_by_value('lineCrossing')
    canvas = driver.find_element(By.ID, 'rule-canvas')
    ActionChains(driver).move_to_element_with_offset(canvas, 0, -80).click().move_to_element_with_offset(
        canvas, 0, 80).click().perform()
    driver.find_element(By.ID, 'search-button').click()
    wait.until(lambda d: re.fullmatch(r'\d+ shown', d.find_element(By.ID, 'count').text))
    assert 0 < len(css('#hits article')) < 201 and {t.split(' · ')[0] for t in driver.execute_script(
        TEXTS, '#hits .where')} == {'Entrance'}

    # Each tab is a client of its own, so one tab's stop cannot end another's search.
    first_client, url = driver.find_element(By.ID, 'client-name').text, driver.current_url
    driver.switch_to.new_window('tab')
    driver.get(url)
    wait.until(lambda d: len(css('#cameras tr[data-camera]')) == 5)
    assert driver.find_element(By.ID, 'client-name').text not in ('', first_client)

    stop_host()
    assert 'does not answer' in search_message(driver, wait)


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument('--host', required=True, help='the delvix-host program')
    parser.add_argument('--screenshot', required=True, help='where the search results picture goes')
    args = parser.parse_args()
    args.host = os.path.abspath(args.host)
    with tempfile.TemporaryDirectory(prefix='explorer-test-') as data:
        subprocess.run([args.host, 'seed', '--data', data, '--objects', '300', '--locations', '5'],
                       check=True, stdout=subprocess.DEVNULL)
        serve = subprocess.Popen([args.host, 'serve', '--data', data, '--listen', '127.0.0.1:0'], cwd=data,
                                 stdout=subprocess.PIPE, text=True)
        driver = None
        try:
            port = re.search(r'http://127\.0\.0\.1:(\d+)', serve.stdout.readline())
            assert port, 'serve did not start'
            driver = browser()
            driver.get(f'http://127.0.0.1:{port.group(1)}/')
            check(driver, WebDriverWait(driver, 60), args.screenshot, lambda: (serve.terminate(), serve.wait(60)))
        finally:
            if driver:
                driver.quit()
            serve.terminate()
            serve.wait(60)
    print('explorer: every check passed; search results in', args.screenshot)


if __name__ == '__main__':
    sys.exit(main())
